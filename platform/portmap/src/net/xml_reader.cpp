#include "net/xml_reader.h"

#include "base/portmap_log.h"

#include <expat.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <memory>
#include <string>
#include <type_traits>

namespace zark::portmap {
namespace {

// Names and texts are handed on as std::string_view of char.
static_assert(std::is_same_v<XML_Char, char>);

struct ParserFree {
  void operator()(XML_Parser parser) const { XML_ParserFree(parser); }
};
using ParserPtr =
    std::unique_ptr<std::remove_pointer_t<XML_Parser>, ParserFree>;

// The state of one ReadXml call, handed to every expat call-back.
struct Reading {
  XML_Parser parser = nullptr;
  XmlVisitor &visitor;
  std::string_view input; // what expat reads, for the raw form of an event
  std::size_t maxDepth = 0;
  std::size_t depth = 0;
  XmlEnd stoppedBy = XmlEnd::kComplete;
};

Reading &Of(void *data) {
  return *static_cast<Reading *>(data);
}

// Expat may still deliver an event or two after XML_StopParser (the end of
// an empty element); they are dropped here.
bool Stopped(const Reading &reading) {
  return reading.stoppedBy != XmlEnd::kComplete;
}

void Stop(Reading &reading, XmlEnd why) {
  if (!Stopped(reading)) {
    reading.stoppedBy = why;
    XML_StopParser(reading.parser, XML_FALSE);
  }
}

std::string_view LocalName(std::string_view name) {
  const std::size_t colon = name.find(':');
  return colon == std::string_view::npos ? name : name.substr(colon + 1);
}

void XMLCALL OnStartElement(void *data, const XML_Char *name,
                            const XML_Char ** /*attributes*/) {
  Reading &reading = Of(data);
  if (Stopped(reading)) {
    return;
  }
  if (reading.depth == reading.maxDepth) {
    Stop(reading, XmlEnd::kRefused);
    return;
  }
  ++reading.depth;
  if (!reading.visitor.OnStart(LocalName(name), reading.depth)) {
    Stop(reading, XmlEnd::kStopped);
  }
}

void XMLCALL OnEndElement(void *data, const XML_Char *name) {
  Reading &reading = Of(data);
  if (Stopped(reading)) {
    return;
  }
  const std::size_t depth = reading.depth--;
  if (!reading.visitor.OnEnd(LocalName(name), depth)) {
    Stop(reading, XmlEnd::kStopped);
  }
}

void XMLCALL OnCharacters(void *data, const XML_Char *text, int length) {
  Reading &reading = Of(data);
  if (Stopped(reading)) {
    return;
  }
  // Expat hands each character reference over alone, and the event's
  // position in the input tells how the character was written.
  const XML_Index at = XML_GetCurrentByteIndex(reading.parser);
  const bool fromReference =
      at >= 0 && static_cast<std::size_t>(at) < reading.input.size() &&
      reading.input.substr(static_cast<std::size_t>(at)).starts_with("&#");
  reading.visitor.OnText(
      std::string_view(text, static_cast<std::size_t>(length)), reading.depth,
      fromReference);
}

// Called for an entity reference that nothing declares: routers copy HTML
// names such as &nbsp; into their descriptions. It stays as written.
void XMLCALL OnSkippedEntity(void *data, const XML_Char *name,
                             int isParameterEntity) {
  Reading &reading = Of(data);
  if (Stopped(reading) || isParameterEntity != 0) {
    return;
  }
  const std::string written = std::string("&") + name + ";";
  reading.visitor.OnText(written, reading.depth, false);
}

// A DOCTYPE could declare entities that expand without bound; a device
// description has no use for one.
void XMLCALL OnDoctype(void *data, const XML_Char * /*name*/,
                       const XML_Char * /*systemId*/,
                       const XML_Char * /*publicId*/,
                       int /*hasInternalSubset*/) {
  Stop(Of(data), XmlEnd::kRefused);
}

void XMLCALL OnEntityDeclaration(void *data, const XML_Char * /*name*/,
                                 int /*isParameterEntity*/,
                                 const XML_Char * /*value*/,
                                 int /*valueLength*/, const XML_Char * /*base*/,
                                 const XML_Char * /*systemId*/,
                                 const XML_Char * /*publicId*/,
                                 const XML_Char * /*notationName*/) {
  Stop(Of(data), XmlEnd::kRefused);
}

// An encoding expat does not know (a router's "gb2312"): ASCII is read as
// such, every other byte as U+FFFD, so ASCII names still come through.
int XMLCALL OnUnknownEncoding(void * /*data*/, const XML_Char * /*name*/,
                              XML_Encoding *info) {
  for (int byte = 0; byte < 256; ++byte) {
    info->map[byte] = byte < 0x80 ? byte : 0xFFFD;
  }
  info->data = nullptr;
  info->convert = nullptr;
  info->release = nullptr;
  return XML_STATUS_OK;
}

// Control characters other than tab, line feed and carriage return are not
// XML characters at all; expat would stop at the first one.
bool ForbiddenControl(char c) {
  const auto byte = static_cast<unsigned char>(c);
  return byte < 0x20 && c != '\t' && c != '\n' && c != '\r';
}

} // namespace

XmlEnd ReadXml(std::string_view xml, XmlVisitor &visitor,
               const XmlLimits &limits) {
  if (xml.size() > limits.maxBytes ||
      xml.size() > static_cast<std::size_t>(INT_MAX)) {
    return XmlEnd::kRefused;
  }
  std::string input(xml);
  std::replace_if(input.begin(), input.end(), ForbiddenControl, ' ');

  ParserPtr parser(XML_ParserCreate(nullptr));
  if (!parser) {
    ZARK_PM_LOG_CALL("XML_ParserCreate", 0, ENOMEM);
    return XmlEnd::kNoParser;
  }
  Reading reading{parser.get(), visitor, input, limits.maxDepth};
  XML_SetUserData(parser.get(), &reading);
  XML_SetElementHandler(parser.get(), OnStartElement, OnEndElement);
  XML_SetCharacterDataHandler(parser.get(), OnCharacters);
  XML_SetStartDoctypeDeclHandler(parser.get(), OnDoctype);
  XML_SetEntityDeclHandler(parser.get(), OnEntityDeclaration);
  XML_SetUnknownEncodingHandler(parser.get(), OnUnknownEncoding, nullptr);
  // Without a DOCTYPE, expat treats a reference to an undeclared entity as
  // fatal. Telling it the document has an outside DTD, which is never read
  // (no external entity handler, no parameter entity parsing), makes it
  // report such references to OnSkippedEntity instead.
  XML_UseForeignDTD(parser.get(), XML_TRUE);
  XML_SetSkippedEntityHandler(parser.get(), OnSkippedEntity);

  const XML_Status status = XML_Parse(parser.get(), input.data(),
                                      static_cast<int>(input.size()), XML_TRUE);
  if (Stopped(reading)) {
    return reading.stoppedBy;
  }
  return status == XML_STATUS_OK ? XmlEnd::kComplete : XmlEnd::kMalformed;
}

} // namespace zark::portmap
