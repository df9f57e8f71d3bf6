// Key/value files: KLIBCFileGetKeyValue, KLIBCFileSetKeyValue and
// KLIBCFileEnumSection. The text is parsed by ParseKeyValueText.
#include "error_state.h"
#include "key_value_parser.h"
#include "sz_list.h"
#include "whole_file.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>

namespace zark::klibc {
namespace {

constexpr std::string_view kBlanks = " \t\r\f\v";

// A key that SetKeyValue can write so that reading finds it again: one line,
// no "=", not a comment or header, no blanks around it.
[[nodiscard]] bool IsWritableKey(std::string_view key) {
  return !key.empty() && key.find_first_of("=\r\n") == std::string_view::npos &&
         key.front() != '#' && key.front() != ';' && key.front() != '[' &&
         kBlanks.find(key.front()) == std::string_view::npos &&
         kBlanks.find(key.back()) == std::string_view::npos;
}

// Quotes a value that reading would otherwise change: blanks around it
// would be trimmed, and a value in quotes would lose them.
[[nodiscard]] std::string FormatLine(std::string_view key,
                                     std::string_view value) {
  const bool quote = !value.empty() &&
                     (kBlanks.find(value.front()) != std::string_view::npos ||
                      kBlanks.find(value.back()) != std::string_view::npos ||
                      value.front() == '"');
  std::string line(key);
  line += '=';
  if (quote) {
    line += '"';
    line += value;
    line += '"';
  } else {
    line += value;
  }
  return line;
}

// The file a write goes to: the target of a symbolic link, so that the link
// stays and its target gets the new content.
[[nodiscard]] std::string WriteTarget(const char *path) {
  struct stat status {};
  if (lstat(path, &status) == 0 && S_ISLNK(status.st_mode)) {
    std::unique_ptr<char, decltype(&std::free)> resolved(
        realpath(path, nullptr), &std::free);
    if (resolved) {
      return resolved.get();
    }
  }
  return path;
}

// Reads the whole of a file that must exist. False when it does not (the
// error recorded as KLIBC_ERR_FILE_NOT_FOUND) or cannot be read (recorded
// by ReadWholeFile).
bool ReadExistingFile(const char *file, std::string &content) {
  switch (ReadWholeFile(file, content)) {
  case ReadStatus::kRead:
    return true;
  case ReadStatus::kMissing:
    KLIBC_RECORD_ERROR(KLIBC_ERR_FILE_NOT_FOUND);
    return false;
  case ReadStatus::kFailed:
    return false;
  }
  return false;
}

int GetKeyValue(const char *file, const char *key, char *buf, int size,
                int flags) {
  if (buf != nullptr && size > 0) {
    buf[0] = '\0';
  }
  if (file == nullptr || key == nullptr || key[0] == '\0' || buf == nullptr ||
      size <= 0 || flags != 0) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  if (!ReadExistingFile(file, content)) {
    return -1;
  }
  const KeyValueText parsed = ParseKeyValueText(content);
  for (const KeyValueEntry &entry : parsed.entries) {
    if (entry.key == key) {
      const std::size_t length =
          std::min(entry.value.size(), static_cast<std::size_t>(size) - 1);
      std::memcpy(buf, entry.value.data(), length);
      buf[length] = '\0';
      return static_cast<int>(length);
    }
  }
  return 0;
}

int SetKeyValue(const char *file, const char *key, const char *value,
                int flags) {
  if (file == nullptr || file[0] == '\0' || key == nullptr ||
      value == nullptr || flags != 0 || !IsWritableKey(key) ||
      std::strpbrk(value, "\r\n") != nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  const std::string target = WriteTarget(file);
  if (target.back() == '/') {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  struct stat old {};
  bool exists = false;
  switch (ReadWholeFile(target.c_str(), content, &old)) {
  case ReadStatus::kRead:
    exists = true;
    break;
  case ReadStatus::kMissing:
    content.clear();
    break;
  case ReadStatus::kFailed:
    return -1;
  }
  const std::string line = FormatLine(key, value);
  const KeyValueText parsed = ParseKeyValueText(content);
  bool replaced = false;
  for (const KeyValueEntry &entry : parsed.entries) {
    if (entry.key == key) {
      content.replace(entry.lineStart, entry.lineEnd - entry.lineStart, line);
      replaced = true;
      break;
    }
  }
  if (!replaced) {
    if (!content.empty() && content.back() != '\n') {
      content += '\n';
    }
    content += line;
    content += '\n';
  }
  if (content.size() > kMaxFileSize) {
    // Written, it could no longer be read.
    KLIBC_RECORD_ERROR(KLIBC_ERR_TOO_LARGE);
    return -1;
  }
  if (!ReplaceFileAtomically(target, content, exists ? &old : nullptr)) {
    return -1;
  }
  return 0;
}

int EnumSection(const char *file, KLIBSZLIST **list) {
  if (file == nullptr || list == nullptr || *list == nullptr) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  std::string content;
  if (!ReadExistingFile(file, content)) {
    return -1;
  }
  const KeyValueText parsed = ParseKeyValueText(content);
  const int32_t before = (*list)->nItem;
  for (const std::string &section : parsed.sections) {
    if (SzListPush(list, section) < 0) {
      SzListTruncate(*list, before);
      return -1;
    }
  }
  return static_cast<int>(parsed.sections.size());
}

} // namespace
} // namespace zark::klibc

extern "C" {

int KLIBCFileGetKeyValue(const char *file, const char *key, char *buf, int size,
                         int flags) {
  return zark::klibc::GuardCBoundary(-1, [&] {
    return zark::klibc::GetKeyValue(file, key, buf, size, flags);
  });
}

int KLIBCFileSetKeyValue(const char *file, const char *key, const char *value,
                         int flags) {
  return zark::klibc::GuardCBoundary(
      -1, [&] { return zark::klibc::SetKeyValue(file, key, value, flags); });
}

int KLIBCFileEnumSection(const char *file, KLIBSZLIST **list) {
  return zark::klibc::GuardCBoundary(
      -1, [&] { return zark::klibc::EnumSection(file, list); });
}

} // extern "C"
