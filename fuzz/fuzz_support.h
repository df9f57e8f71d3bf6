// What the fuzz targets share: stating a broken promise, cutting one input
// into the pieces a target needs, and the private namespaces that keep a
// target off the machine's own files and network.
//
// Every target defines LLVMFuzzerTestOneInput (and LLVMFuzzerInitialize
// when it needs set-up). The same source is linked twice: with libFuzzer
// (clang only) for fuzzing, and with corpus_runner.cpp (any compiler) into
// the regression test that runs the saved corpus.
#ifndef ZARK_FUZZ_FUZZ_SUPPORT_H
#define ZARK_FUZZ_FUZZ_SUPPORT_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace zark::fuzz {

// Prints "broken promise: <what>" and the input's size to stderr and aborts,
// so that libFuzzer saves the input as a crash and the corpus test fails.
[[noreturn]] void Broken(const std::string &what);

// Broken(what) unless condition holds.
inline void Require(bool condition, const std::string &what) {
  if (!condition) {
    Broken(what);
  }
}

// The input as text.
inline std::string_view AsText(const uint8_t *data, std::size_t size) {
  return {reinterpret_cast<const char *>(data), size};
}

// Reads an input front to back: single bytes that choose what to do, then
// pieces of text. Reading past the end gives zeros and empty pieces, so a
// short input is still a whole (if dull) case.
class InputReader {
public:
  explicit InputReader(std::string_view input) : mRest(input) {}

  [[nodiscard]] uint8_t Byte();
  [[nodiscard]] uint16_t Uint16(); // big-endian
  [[nodiscard]] bool Bool() { return (Byte() & 1) != 0; }
  // Up to the next separator (dropped), or the rest when there is none.
  [[nodiscard]] std::string_view Piece(std::string_view separator);
  [[nodiscard]] std::string_view Rest();
  [[nodiscard]] bool Empty() const { return mRest.empty(); }

private:
  std::string_view mRest;
};

// The separator of the text pieces of multi-part inputs (a root description
// and the SOAP replies after it, the files of a router database...): a line
// of its own, so that seed files stay readable.
inline constexpr std::string_view kPieceSeparator = "\n--8<--\n";

// Splits text at every kPieceSeparator.
[[nodiscard]] std::vector<std::string_view> SplitPieces(std::string_view text);

// Enters a private mount namespace (fresh /tmp, overlays over /etc and /usr,
// empty fixed folders; tests/support/hermetic.h) or aborts saying why. Call
// from LLVMFuzzerInitialize, before any thread starts.
void EnterHermeticOrDie();

// Enters a private network namespace whose only interface is loopback, up,
// or aborts saying why. Targets that play a router on 127.0.0.1 use it so
// that whatever address a fuzzed reply names, nothing but our own fake can
// answer, and no packet leaves the machine.
void EnterPrivateNetworkOrDie();

// Connects to 127.0.0.1:port, sends bytes, closes its sending side and
// reads until the peer closes, at most maxBytes and for at most limitMs in
// all. What was read; empty when the connection could not be made.
[[nodiscard]] std::string ExchangeOverTcp(uint16_t port, std::string_view bytes,
                                          std::size_t maxBytes, int limitMs);

} // namespace zark::fuzz

#endif
