#include "platform/values/error.h"

namespace platform {

std::string Error::localizedDescription() const {
  if (userInfo_) {
    auto it = userInfo_->find(LocalizedDescriptionKey);
    if (it != userInfo_->end() && it->second.string()) return *it->second.string();
  }
  return "The operation couldn't be completed. (" + domain_ + " error " + std::to_string(code_) + ".)";
}

std::string Error::description() const {
  std::string out =
      "Error Domain=" + domain_ + " Code=" + std::to_string(code_) + " \"" + localizedDescription() + "\"";
  if (userInfo_) out += " UserInfo=" + Value(*userInfo_).description();
  return out;
}

}  // namespace platform
