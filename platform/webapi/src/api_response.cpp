// APIResponse: the answer to one request, shared between the thread that
// answers and the host (or the polling facility) that reads it.
#include "webapi.h"

#include <mutex>
#include <utility>

namespace ZARK {

struct APIResponse::Impl {
  mutable std::mutex mutex;
  State state = State::None;
  Json::Value data;      // current answer's data when state is Success
  int errorCode = 0;     // current answer's code when state is Error
  Json::Value errorData; // current answer's data when state is Error
  std::shared_ptr<Listener> listener;
};

APIResponse::APIResponse() : mImpl(std::make_unique<Impl>()) {}

APIResponse::~APIResponse() = default;

void APIResponse::SetSuccess(const Json::Value &data) {
  std::shared_ptr<Listener> listener;
  {
    std::lock_guard lock(mImpl->mutex);
    mImpl->state = State::Success;
    mImpl->data = data;
    mImpl->errorCode = 0;
    mImpl->errorData = Json::Value();
    listener = mImpl->listener;
  }
  // Outside the lock: a listener may read this response back.
  if (listener) {
    listener->OnSuccess(data);
  }
}

void APIResponse::SetError(int code, const Json::Value &data) {
  std::shared_ptr<Listener> listener;
  {
    std::lock_guard lock(mImpl->mutex);
    mImpl->state = State::Error;
    mImpl->data = Json::Value();
    mImpl->errorCode = code;
    mImpl->errorData = data;
    listener = mImpl->listener;
  }
  if (listener) {
    listener->OnError(code, data);
  }
}

APIResponse::State APIResponse::GetState() const {
  std::lock_guard lock(mImpl->mutex);
  return mImpl->state;
}

Json::Value APIResponse::GetData() const {
  std::lock_guard lock(mImpl->mutex);
  return mImpl->data;
}

int APIResponse::GetErrorCode() const {
  std::lock_guard lock(mImpl->mutex);
  return mImpl->errorCode;
}

Json::Value APIResponse::GetErrorData() const {
  std::lock_guard lock(mImpl->mutex);
  return mImpl->errorData;
}

void APIResponse::SetListener(std::shared_ptr<Listener> listener) {
  std::lock_guard lock(mImpl->mutex);
  mImpl->listener = std::move(listener);
}

} // namespace ZARK
