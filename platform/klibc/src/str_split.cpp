// KLIBCStrSep and KLIBCStrTok: splitting a text at a set of separator
// characters into a KLIBSZLIST.
#include "error_state.h"
#include "sz_list.h"

#include <string_view>

namespace zark::klibc {
namespace {

// Appends the pieces of text between separators; empty pieces only when
// keepEmpty. On failure the pieces already appended are taken back.
int SplitInto(const char *text, const char *sep, KLIBSZLIST **list,
              bool keepEmpty) {
  if (text == nullptr || sep == nullptr || list == nullptr ||
      *list == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  const std::string_view whole(text);
  const std::string_view separators(sep);
  if (whole.empty()) {
    return 0;
  }
  const int32_t before = (*list)->nItem;
  int appended = 0;
  std::size_t start = 0;
  for (;;) {
    const std::size_t end = whole.find_first_of(separators, start);
    const std::string_view piece = whole.substr(
        start,
        end == std::string_view::npos ? std::string_view::npos : end - start);
    if (keepEmpty || !piece.empty()) {
      if (SzListPush(list, piece) < 0) {
        SzListTruncate(*list, before);
        return -1;
      }
      ++appended;
    }
    if (end == std::string_view::npos) {
      return appended;
    }
    start = end + 1;
  }
}

} // namespace
} // namespace zark::klibc

extern "C" {

int KLIBCStrSep(const char *text, const char *sep, KLIBSZLIST **list) {
  return zark::klibc::SplitInto(text, sep, list, true);
}

int KLIBCStrTok(const char *text, const char *sep, KLIBSZLIST **list) {
  return zark::klibc::SplitInto(text, sep, list, false);
}

} // extern "C"
