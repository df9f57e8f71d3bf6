// The headers nearly every test file includes, compiled once per build
// and reused by every test executable (zark_add_test): GoogleTest and the
// standard library take most of a test file's compile time.
#ifndef ZARK_TESTS_SUPPORT_TEST_PCH_H
#define ZARK_TESTS_SUPPORT_TEST_PCH_H

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <sstream>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#endif
