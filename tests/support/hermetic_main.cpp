// main() of hermetic test executables: enters the private mount namespace,
// then runs the tests. Listing the tests (as CTest does while building)
// needs no namespace.
#include "hermetic.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <string>

int main(int argc, char **argv) {
  bool listing = false;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--gtest_list_tests") == 0) {
      listing = true;
    }
  }
  if (!listing) {
    std::string error;
    if (!zark::test::EnterPrivateMountNamespace(&error)) {
      fprintf(stderr,
              "cannot enter a private mount namespace (%s); these tests "
              "need root and must not touch the machine's own files\n",
              error.c_str());
      return 1;
    }
  }
  testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}
