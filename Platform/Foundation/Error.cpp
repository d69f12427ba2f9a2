#include "Platform/Foundation/Error.h"

namespace platform {

Error::Error(std::string domain, int64_t code, Dictionary userInfo)
    : domain_(std::move(domain)), code_(code), userInfo_(std::move(userInfo)) {}

std::string Error::localizedDescription() const {
  auto it = userInfo_.find(kLocalizedDescriptionKey);
  if (it == userInfo_.end()) return "";
  const std::string* s = it->second.asString();
  return s ? *s : it->second.description();
}

const Error* Error::underlyingError() const {
  auto it = userInfo_.find(kUnderlyingErrorKey);
  return it == userInfo_.end() ? nullptr : it->second.asError();
}

std::string Error::description() const {
  std::string out = "Error Domain=" + domain_ + " Code=" + std::to_string(code_);
  std::string message = localizedDescription();
  if (!message.empty()) out += " \"" + message + "\"";
  out += " UserInfo=" + Value(userInfo_).description();
  return out;
}

}  // namespace platform
