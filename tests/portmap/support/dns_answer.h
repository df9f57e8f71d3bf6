// The answer side of DNS for tests: turns a query datagram into a reply
// without allocating, so that a forked child (the test network's outside
// DNS server) can use it as well as the loopback fake's thread.
#ifndef ZARK_TESTS_DETECT_DNS_ANSWER_H
#define ZARK_TESTS_DETECT_DNS_ANSWER_H

#include <cstddef>
#include <cstdint>

namespace zark::test {

// Answers query (a standard query for one name): when its question is
// name (dotted, compared without regard to case) of type A, class IN, the
// reply carries one A record of address (host byte order); for any other
// name the reply says NXDOMAIN (rcode 3). Writes the reply into out and
// returns its length; 0 when query is not a query this can answer or out
// is too small.
std::size_t BuildDnsAnswer(const uint8_t *query, std::size_t queryLength,
                           const char *name, uint32_t address, uint8_t *out,
                           std::size_t capacity);

} // namespace zark::test

#endif
