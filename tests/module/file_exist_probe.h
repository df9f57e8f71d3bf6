// Stands in front of the core library's KLIBCFileExist in a test process:
// records every path asked about and forwards the question to the library.
// Before the process has entered its private mount namespace it answers 0
// without looking, so that the module's load-time check (which runs before
// main() when the module is linked into the test) never reads the machine's
// own /etc.
#ifndef ZARK_TESTS_MODULE_FILE_EXIST_PROBE_H
#define ZARK_TESTS_MODULE_FILE_EXIST_PROBE_H

#include <string>
#include <vector>

namespace zark::moduletest {

struct FileExistCall {
  std::string path;
  bool beforeNamespace; // asked before the private namespace was entered
  int result;           // what the caller got
};

// Every call so far, in order (at most the first 64).
std::vector<FileExistCall> FileExistCalls();

// Forgets the calls recorded so far.
void ClearFileExistCalls();

} // namespace zark::moduletest

#endif
