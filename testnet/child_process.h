// Test helper (the test network, benchmarks): running a program without a
// shell: fork and execve with an argument vector, a clean environment, no
// inherited descriptors, output captured up to a bound, and a deadline after
// which the program is killed.
#ifndef ZARK_TESTS_CHILD_PROCESS_H
#define ZARK_TESTS_CHILD_PROCESS_H

#include <chrono>
#include <cstddef>
#include <string>
#include <vector>

namespace zark::test {

struct ChildOptions {
  std::chrono::milliseconds timeout{30000};
  // Standard output beyond this many bytes kills the program.
  std::size_t maxOutput = 1u << 20;
  // RLIMIT_FSIZE of the program: no file it writes can grow larger (0: the
  // limit is left as it is).
  std::size_t maxFileSize = 0;
};

struct ChildResult {
  bool started = false;        // fork and execve worked
  bool exited = false;         // it ended by itself (not by a signal)
  int exitStatus = -1;         // its exit status when exited
  bool timedOut = false;       // killed at the deadline
  bool outputTooLarge = false; // killed for writing too much
  std::string output;          // its standard output
  std::string errors;          // the first 4 KiB of its standard error

  // Ran, ended by itself with status 0, and was not cut short.
  [[nodiscard]] bool Succeeded() const {
    return started && exited && exitStatus == 0 && !timedOut && !outputTooLarge;
  }
};

// Runs program (an absolute path) with args (args[0] is the program's name)
// and waits for it, at most options.timeout. Its environment holds only
// PATH=/usr/sbin:/usr/bin:/sbin:/bin and LC_ALL=C; its standard input is
// /dev/null. Failures to start it are logged; how it ended is the caller's
// to judge.
[[nodiscard]] ChildResult RunProgram(const std::string &program,
                                     const std::vector<std::string> &args,
                                     const ChildOptions &options);

} // namespace zark::test

#endif
