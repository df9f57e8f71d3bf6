// APIRequest: the parameters of one request as a JSON object.
#include "webapi.h"

#include <utility>

namespace ZARK {

APIRequest::APIRequest() : mParams(Json::objectValue) {}

// Parameters always form an object, so that GetParam and HasParam never
// meet an array or a scalar (on which JsonCpp's member access would throw).
APIRequest::APIRequest(Json::Value params)
    : mParams(params.isObject() ? std::move(params)
                                : Json::Value(Json::objectValue)) {}

APIRequest::~APIRequest() = default;

Json::Value APIRequest::GetParam(const std::string &name,
                                 const Json::Value &def) const {
  const Json::Value *value =
      mParams.find(name.data(), name.data() + name.size());
  return value != nullptr ? *value : def;
}

bool APIRequest::HasParam(const std::string &name) const {
  return mParams.find(name.data(), name.data() + name.size()) != nullptr;
}

void APIRequest::SetParam(const std::string &name, const Json::Value &value) {
  mParams[name] = value;
}

} // namespace ZARK
