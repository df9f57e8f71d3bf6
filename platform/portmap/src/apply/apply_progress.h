// Progress of applying rules, told two ways: the file /tmp/pfProgress that
// the module's save_status reads, one line "del=<done>/<total>" during the
// deletions and then "add=<done>/<total>" during the additions; and the
// save's callback with a percentage, 0 to 50 for the deletions and 50 to
// 100 for the additions.
#ifndef ZARK_PORTMAP_APPLY_PROGRESS_H
#define ZARK_PORTMAP_APPLY_PROGRESS_H

#include "libzarkportmap.h"

#include <string>
#include <string_view>

namespace zark::portmap {

// The percentage of a stage: "del" done/total gives 0..50, "add" 50..100
// (a stage with total 0 counts as done).
[[nodiscard]] int ProgressPercentage(std::string_view stage, int done,
                                     int total);

// "del=3/6\n"
[[nodiscard]] std::string ProgressLine(std::string_view stage, int done,
                                       int total);

class ApplyProgress {
public:
  // path empty: no file. callback may be null. result receives the
  // percentage before each callback.
  ApplyProgress(std::string path, ZARK_SAVE_RULE_PROGRESS_CB callback,
                void *arg, ZARK_ROUTER_SAVE_RULE_RESULT *result);
  ApplyProgress(const ApplyProgress &) = delete;
  ApplyProgress &operator=(const ApplyProgress &) = delete;
  // Removes the file: a finished job leaves no progress behind.
  ~ApplyProgress();

  // Rewrites the file with the stage line (a reader sees the old line or
  // the new one, never a part) and calls back with the percentage.
  void Report(std::string_view stage, int done, int total);
  // Calls back with 100.
  void Finish();

private:
  void Call(int percentage);

  std::string mPath;
  ZARK_SAVE_RULE_PROGRESS_CB mCallback;
  void *mArg;
  ZARK_ROUTER_SAVE_RULE_RESULT *mResult;
  bool mWrote = false;
};

} // namespace zark::portmap

#endif
