// Error records: domain, code and a user-info dictionary.
//
// The platform's two standard user-info keys are named by role:
// kLocalizedDescriptionKey holds the human-readable message and
// kUnderlyingErrorKey the record of the failure that caused this one. Failed
// system calls use kPOSIXErrorDomain with errno as the code.
//
// The text form ("%@") is
//   Error Domain=D Code=N "description" UserInfo={key=value, ...}
// where the description is the record's message, or for a POSIX record
// without one the strerror text of its code, or "(null)"; the UserInfo part
// is left out when the user-info is empty. Keys come in sorted order.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "Platform/Value.h"

namespace sl {

inline constexpr const char kPOSIXErrorDomain[] = "POSIXErrorDomain";
// Errors of the platform's own file services (reading a whole file and the
// like); kFileReadNoSuchFileError is what a missing file gives there.
inline constexpr const char kFileErrorDomain[] = "FileErrorDomain";
inline constexpr int64_t kFileReadNoSuchFileError = 260;
inline constexpr int64_t kFileReadUnknownError = 256;
inline constexpr int64_t kFileReadNoPermissionError = 257;

inline constexpr const char kLocalizedDescriptionKey[] = "LocalizedDescription";
inline constexpr const char kUnderlyingErrorKey[] = "UnderlyingError";

class Error : public Value {
 public:
  Error() = default;
  Error(std::nullptr_t) {}  // NOLINT
  Error(std::string_view domain, int64_t code, Dictionary userInfo = nullptr);

  // A POSIX record for errno value `code`, with `description` as its message
  // when one is given.
  static Error posix(int code, std::string_view description = {});

  // "" for a null record.
  const std::string& domain() const;
  // 0 for a null record.
  int64_t code() const;
  // Never null for a non-null record (possibly empty).
  Dictionary userInfo() const;

  // The entry under kLocalizedDescriptionKey when it is a string, else null.
  String localizedDescription() const;
  // The entry under kUnderlyingErrorKey when it is a record, else null.
  Error underlyingError() const;

  bool isPOSIX(int code) const { return domain() == kPOSIXErrorDomain && this->code() == code; }

 private:
  friend class Value;
  explicit Error(std::shared_ptr<const detail::Node> n) : Value(std::move(n)) {}
};

}  // namespace sl
