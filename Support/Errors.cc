#include "Support/Errors.h"

#include "Support/Log.h"

extern "C" {
const char SLInstallerErrorDomain[] = "SLInstallerErrorDomain";
const char SLFunctionNameErrorKey[] = "FunctionName";
const char SLSourceFileLineErrorKey[] = "SourceFileLine";
const char SLPathArgumentErrorKey[] = "PathArgument";
const char SLLibSLVErrorNumberKey[] = "LibSLVErrorNumber";
}

sl::Error _CreateErrorV(const char* function, int32_t line, std::string_view domain, int64_t code,
                        std::string_view format, sl::FormatArgs args) {
  sl::Dictionary userInfo = {
      {sl::kLocalizedDescriptionKey, sl::String(sl::formatArgs(format, args))},
      {SLFunctionNameErrorKey, sl::String(function)},
      {SLSourceFileLineErrorKey, sl::Number(static_cast<int64_t>(line))},
  };
  return sl::Error(domain, code, std::move(userInfo));
}

sl::Error _CreateAndLogErrorV(const char* function, int32_t line, std::string_view domain, int64_t code,
                              const sl::Error& underlying, const sl::Dictionary& userInfo, const char* format,
                              sl::FormatArgs args) {
  // A copy of the handle: the caller's dictionary stays as it was.
  sl::Dictionary info = userInfo ? userInfo : sl::Dictionary::create();

  if (format != nullptr) {
    sl::String message(sl::formatArgs(format, args));
    info.set(sl::kLocalizedDescriptionKey, message);
    // The line goes out under the caller's name, not this function's.
    if (underlying)
      SLLog(sl::kLogLevelError, function, "%d: %@ (%@)", line, message, underlying);
    else
      SLLog(sl::kLogLevelError, function, "%d: %@", line, message);
  }
  if (underlying) info.set(sl::kUnderlyingErrorKey, underlying);
  info.set(SLFunctionNameErrorKey, sl::String(function));
  info.set(SLSourceFileLineErrorKey, sl::Number(static_cast<int64_t>(line)));
  return sl::Error(domain, code, std::move(info));
}
