// The per-thread error state: code, file and line of the last recorded
// failure.
#include "error_state.h"

#include <array>
#include <cstring>

namespace {

// Longest file text kept; longer texts are cut. The text is copied because
// callers pass __FILE__ of libraries that may be unloaded, or buffers that
// die before the state is read.
constexpr std::size_t kMaxFileText = 255;

struct ErrorState {
  int code;
  int line;
  std::array<char, kMaxFileText + 1> file;
};

// Constant-initialised, so no thread pays for a constructor and recording
// an error never allocates.
constinit thread_local ErrorState tState{};

} // namespace

extern "C" {

void KLIBCErrSetEx(int code, const char *file, int line) {
  tState.code = code;
  tState.line = line;
  std::size_t length = 0;
  if (file != nullptr) {
    length = strnlen(file, kMaxFileText);
    std::memcpy(tState.file.data(), file, length);
  }
  tState.file[length] = '\0';
}

int KLIBCErrGet(void) {
  return tState.code;
}

const char *KLIBCErrorGetFile(void) {
  return tState.file.data();
}

int KLIBCErrorGetLine(void) {
  return tState.line;
}

} // extern "C"
