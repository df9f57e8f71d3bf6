#include "dns_answer.h"

#include <strings.h>

#include <cctype>
#include <cstring>

namespace zark::test {

std::size_t BuildDnsAnswer(const uint8_t *query, std::size_t queryLength,
                           const char *name, uint32_t address, uint8_t *out,
                           std::size_t capacity) {
  // Header (12 bytes), then the question: labels, type, class.
  if (queryLength < 17 || (query[2] & 0x80) != 0 || query[4] != 0 ||
      query[5] != 1) {
    return 0;
  }
  std::size_t at = 12;
  char asked[256];
  std::size_t askedLength = 0;
  while (at < queryLength && query[at] != 0) {
    const std::size_t label = query[at];
    if (label > 63 || at + 1 + label >= queryLength ||
        askedLength + label + 1 >= sizeof(asked)) {
      return 0;
    }
    if (askedLength != 0) {
      asked[askedLength++] = '.';
    }
    for (std::size_t i = 0; i < label; ++i) {
      asked[askedLength++] = static_cast<char>(
          std::tolower(static_cast<unsigned char>(query[at + 1 + i])));
    }
    at += 1 + label;
  }
  asked[askedLength] = '\0';
  if (at + 5 > queryLength) {
    return 0;
  }
  const std::size_t questionEnd = at + 5; // the root label, type, class
  const bool isA = query[at + 1] == 0 && query[at + 2] == 1 &&
                   query[at + 3] == 0 && query[at + 4] == 1;
  const bool known = isA && strcasecmp(asked, name) == 0;
  const std::size_t length = questionEnd + (known ? 16 : 0);
  if (length > capacity) {
    return 0;
  }
  std::memcpy(out, query, questionEnd);
  out[2] = static_cast<uint8_t>(0x80 | (query[2] & 0x01)); // QR, RD kept
  out[3] = static_cast<uint8_t>(0x80 | (known ? 0 : 3));   // RA, rcode
  out[6] = 0;
  out[7] = known ? 1 : 0; // answers
  std::memset(out + 8, 0, 4);
  if (known) {
    uint8_t *record = out + questionEnd;
    const uint8_t answer[16] = {0xC0,
                                12, // the name: a pointer to the question's
                                0,
                                1,
                                0,
                                1, // type A, class IN
                                0,
                                0,
                                0,
                                60, // TTL 60 s
                                0,
                                4, // four bytes of address
                                static_cast<uint8_t>(address >> 24),
                                static_cast<uint8_t>(address >> 16),
                                static_cast<uint8_t>(address >> 8),
                                static_cast<uint8_t>(address)};
    std::memcpy(record, answer, sizeof(answer));
  }
  return length;
}

} // namespace zark::test
