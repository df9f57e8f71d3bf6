// Internal helpers for recording failures in the calling thread's error
// state and for keeping exceptions inside the library's C functions.
#ifndef ZARK_PLATFORM_KLIBC_ERROR_STATE_H
#define ZARK_PLATFORM_KLIBC_ERROR_STATE_H

#include "klibc.h"

#include <new>
#include <stdexcept>

// Records code with the file and line of the place that failed.
#define KLIBC_RECORD_ERROR(code) KLIBCErrSetEx((code), __FILE__, __LINE__)

namespace zark::klibc {

// Runs body and returns its result. An exception that would otherwise leave
// a C function is recorded and turned into failResult. Only allocation
// failures can throw in this library (std::bad_alloc, and std::length_error
// for a size no allocation can hold), so all of them count as
// KLIBC_ERR_OUT_OF_MEMORY.
template <typename Result, typename Body>
Result GuardCBoundary(Result failResult, Body &&body) noexcept {
  try {
    return body();
  } catch (const std::bad_alloc &) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_OUT_OF_MEMORY);
  } catch (const std::length_error &) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_OUT_OF_MEMORY);
  } catch (...) {
    KLIBC_RECORD_ERROR(KLIBC_ERR_OUT_OF_MEMORY);
  }
  return failResult;
}

} // namespace zark::klibc

#endif
