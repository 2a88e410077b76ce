// Error records of the system: the exported domain and user-info keys, and
// the three constructors that stamp each record with the function and the
// source line that made it.
//
// Contract shared by every operation that takes an error out-slot: the slot
// (an sl::Error*) may be null; when it is not, it is written only when the
// operation fails, and left as the caller set it on success.
#pragma once

#include <cstdint>
#include <string_view>

#include "Platform/Error.h"
#include "Platform/Format.h"
#include "Platform/Value.h"

extern "C" {
extern const char SLInstallerErrorDomain[];    // "SLInstallerErrorDomain"
extern const char SLFunctionNameErrorKey[];    // "FunctionName"
extern const char SLSourceFileLineErrorKey[];  // "SourceFileLine"
extern const char SLPathArgumentErrorKey[];    // "PathArgument"
extern const char SLLibSLVErrorNumberKey[];    // "LibSLVErrorNumber"
}

// Codes of SLInstallerErrorDomain that the system raises.
inline constexpr int64_t kSLInstallerFileSystemError = 4;       // temporary directory, bundle attributes
inline constexpr int64_t kSLInstallerStoreDataCaptureError = 24;
inline constexpr int64_t kSLInstallerInvalidSymlinkError = 70;

// A record whose user-info holds exactly the formatted message, the function
// name and the line. Logs nothing.
sl::Error _CreateErrorV(const char* function, int32_t line, std::string_view domain, int64_t code,
                        std::string_view format, sl::FormatArgs args);

template <class... Args>
sl::Error _CreateError(const char* function, int32_t line, std::string_view domain, int64_t code,
                       sl::FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  const sl::FormatArg packed[] = {sl::format_detail::makeArg(args)..., sl::FormatArg{}};
  return _CreateErrorV(function, line, domain, code, format.get(), sl::FormatArgs(packed, sizeof...(Args)));
}

// Starts from a copy of userInfo (the caller's dictionary is never changed);
// with a format, stores the message and writes it to the installer log at
// level error, as "%d: %@ (%@)" with the underlying record or "%d: %@"
// without one; stores the underlying record; stores the function name and
// the line, replacing what userInfo held under those keys. `format` may be
// null: then the record has no message and nothing is logged.
sl::Error _CreateAndLogErrorV(const char* function, int32_t line, std::string_view domain, int64_t code,
                              const sl::Error& underlying, const sl::Dictionary& userInfo, const char* format,
                              sl::FormatArgs args);

template <class... Args>
sl::Error _CreateAndLogError(const char* function, int32_t line, std::string_view domain, int64_t code,
                             const sl::Error& underlying, const sl::Dictionary& userInfo,
                             sl::FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  const sl::FormatArg packed[] = {sl::format_detail::makeArg(args)..., sl::FormatArg{}};
  // The format's view is a literal or a RuntimeFormat the caller keeps alive;
  // it is copied into a terminated string for the V-variant.
  std::string terminated(format.get());
  return _CreateAndLogErrorV(function, line, domain, code, underlying, userInfo, terminated.c_str(),
                             sl::FormatArgs(packed, sizeof...(Args)));
}

// The form without a message.
inline sl::Error _CreateAndLogError(const char* function, int32_t line, std::string_view domain, int64_t code,
                                    const sl::Error& underlying, const sl::Dictionary& userInfo, std::nullptr_t) {
  return _CreateAndLogErrorV(function, line, domain, code, underlying, userInfo, nullptr, {});
}

namespace sl {
// Writes `record` to an optional out-slot and returns false, for the common
// "fail with this record" exit: `return fail(error, _CreateError(...));`
inline bool fail(Error* slot, Error record) {
  if (slot != nullptr) *slot = std::move(record);
  return false;
}
}  // namespace sl
