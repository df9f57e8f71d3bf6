// Keeps tests off the machine's own files. A hermetic test executable enters
// a private mount namespace before any test runs: /tmp gets a fresh tmpfs,
// /etc and /usr get overlays whose writes land in memory, and the fixed
// folders of the port-forwarding code (/etc/portforward, /usr/zark,
// /usr/local/etc/services.d, /etc.defaults) start empty. Nothing a test
// writes there reaches the machine, and all of it is gone when the process
// ends.
#ifndef ZARK_TESTS_HERMETIC_H
#define ZARK_TESTS_HERMETIC_H

#include <string>

namespace zark::test {

// Enters the namespace. Must run before the process starts any thread.
// False, with a reason, when the kernel or the user's rights do not allow it.
bool EnterPrivateMountNamespace(std::string *error);

// True once EnterPrivateMountNamespace succeeded in this process.
bool InPrivateMountNamespace();

// Empties the fixed folders and /tmp again, for tests that share a process.
// Aborts the test process when called outside the namespace.
void ResetFixedPaths();

// Writes a file (creating its folders), for test set-up. Aborts outside the
// namespace when path lies under a fixed folder.
void WriteFile(const std::string &path, const std::string &content,
               unsigned mode = 0644);
std::string ReadFile(const std::string &path);

} // namespace zark::test

#endif
