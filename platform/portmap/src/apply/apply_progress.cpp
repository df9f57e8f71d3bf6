#include "apply/apply_progress.h"

#include "base/portmap_log.h"
#include "base/unique_fd.h"

#include "klibc_replace.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <utility>

namespace zark::portmap {
namespace {

// Replaces path by a new file holding text: a temporary file beside it,
// renamed over it. Not flushed to disk: progress is worth nothing after a
// crash. rename() replaces a symlink at path rather than following it.
bool ReplaceProgressFile(const std::string &path, std::string_view text) {
  klibc::ReplaceOptions options;
  options.mode = 0644;
  options.tempName = klibc::TempName::kBesidePath;
  options.flush = false;
  const std::optional<klibc::ReplaceFailure> failure =
      klibc::ReplaceFile(path, text, options);
  if (!failure) {
    return true;
  }
  if (failure->step == klibc::ReplaceStep::kCreateTemp) {
    ZARK_PM_LOG_CALL("mkostemp", -1, failure->error, failure->tempPath.c_str());
  } else {
    ZARK_PM_LOG_CALL("write progress", -1, failure->error, path.c_str());
  }
  return false;
}

} // namespace

int ProgressPercentage(std::string_view stage, int done, int total) {
  int half = total <= 0 ? 50 : static_cast<int>(50LL * done / total);
  if (half > 50) {
    half = 50;
  }
  return stage == "add" ? 50 + half : half;
}

std::string ProgressLine(std::string_view stage, int done, int total) {
  return std::string(stage) + "=" + std::to_string(done) + "/" +
         std::to_string(total) + "\n";
}

ApplyProgress::ApplyProgress(std::string path,
                             ZARK_SAVE_RULE_PROGRESS_CB callback, void *arg,
                             ZARK_ROUTER_SAVE_RULE_RESULT *result)
    : mPath(std::move(path)), mCallback(callback), mArg(arg), mResult(result) {}

ApplyProgress::~ApplyProgress() {
  if (mWrote && ::unlink(mPath.c_str()) != 0 && errno != ENOENT) {
    ZARK_PM_LOG_CALL("unlink", -1, errno, mPath.c_str());
  }
}

void ApplyProgress::Report(std::string_view stage, int done, int total) {
  if (!mPath.empty() &&
      ReplaceProgressFile(mPath, ProgressLine(stage, done, total))) {
    mWrote = true;
  }
  Call(ProgressPercentage(stage, done, total));
}

void ApplyProgress::Finish() {
  Call(100);
}

void ApplyProgress::Call(int percentage) {
  if (mResult != nullptr) {
    mResult->percentage = percentage;
  }
  if (mCallback != nullptr && mResult != nullptr) {
    mCallback(mResult, mArg);
  }
}

} // namespace zark::portmap
