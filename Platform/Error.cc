#include "Platform/Error.h"

#include "Platform/ValueNodes.h"

namespace sl {

using detail::ErrorNode;

Error::Error(std::string_view domain, int64_t code, Dictionary userInfo)
    : Value(std::make_shared<ErrorNode>(std::string(domain), code,
                                        userInfo ? std::move(userInfo) : Dictionary::create())) {}

Error Error::posix(int code, std::string_view description) {
  Dictionary info = Dictionary::create();
  if (!description.empty()) info.set(kLocalizedDescriptionKey, String(description));
  return Error(kPOSIXErrorDomain, code, std::move(info));
}

const std::string& Error::domain() const {
  static const std::string empty;
  return node() ? static_cast<const ErrorNode*>(node())->domain : empty;
}

int64_t Error::code() const { return node() ? static_cast<const ErrorNode*>(node())->code : 0; }

Dictionary Error::userInfo() const { return node() ? static_cast<const ErrorNode*>(node())->userInfo : Dictionary(); }

String Error::localizedDescription() const { return userInfo().get(kLocalizedDescriptionKey).asString(); }

Error Error::underlyingError() const { return userInfo().get(kUnderlyingErrorKey).asError(); }

}  // namespace sl
