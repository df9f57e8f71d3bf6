// Reading XML that routers send (device descriptions) with expat, as a
// stream of element and text events. Element names come without their
// namespace prefix ("u:device" is "device"), text comes decoded. A
// document with a DOCTYPE is refused, so no entity the document declares
// is ever expanded; nesting and size are bounded.
#ifndef ZARK_PORTMAP_XML_READER_H
#define ZARK_PORTMAP_XML_READER_H

#include <cstddef>
#include <string_view>

namespace zark::portmap {

// What ReadXml calls, in document order. depth is 1 for the document
// element, 2 for its children, and so on.
class XmlVisitor {
public:
  virtual ~XmlVisitor() = default;
  // An element opens. False stops the reading.
  [[nodiscard]] virtual bool OnStart(std::string_view name,
                                     std::size_t depth) = 0;
  // The element at depth closes (an empty element <a/> opens and closes).
  // False stops the reading.
  [[nodiscard]] virtual bool OnEnd(std::string_view name,
                                   std::size_t depth) = 0;
  // A piece of text inside the element at depth; one text may come in
  // several pieces (CDATA, entities and line ends start new ones).
  // fromReference: the piece is one character written as a character
  // reference (&#46; or &#x263A;), in UTF-8.
  virtual void OnText(std::string_view text, std::size_t depth,
                      bool fromReference) = 0;
};

struct XmlLimits {
  std::size_t maxBytes = 0; // a longer document is refused unread
  std::size_t maxDepth = 0; // an element deeper than this stops the reading
};

enum class XmlEnd {
  kComplete,  // the whole document was read and is well-formed
  kStopped,   // the visitor returned false
  kMalformed, // not well-formed; the events before the fault were delivered
  kRefused,   // a DOCTYPE, an element beyond maxDepth or more than maxBytes
  kNoParser,  // expat could not create a parser (out of memory; logged)
};

// Reads xml and calls visitor for what it holds. Read leniently, as routers
// write it:
// - control characters that XML forbids are read as blanks;
// - an entity the document does not declare (&nbsp;) is passed on as
//   written, as text;
// - in an encoding expat does not know, bytes beyond ASCII read as U+FFFD.
// Results: see XmlEnd.
[[nodiscard]] XmlEnd ReadXml(std::string_view xml, XmlVisitor &visitor,
                             const XmlLimits &limits);

} // namespace zark::portmap

#endif
