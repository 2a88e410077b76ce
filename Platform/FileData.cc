#include "Platform/FileData.h"

#include <cerrno>
#include <cstdint>
#include <vector>

#include "Platform/Format.h"
#include "Platform/PropertyList.h"

namespace sl {

Data dataWithContentsOfURL(const URL& url, Error* error) {
  std::vector<uint8_t> bytes;
  Error posixError;
  if (readFileContents(url, &bytes, &posixError)) return Data(std::move(bytes));
  if (error != nullptr) {
    const int64_t errnoCode = posixError.code();
    int64_t code = kFileReadUnknownError;
    const char* reason = "could not be read";
    if (errnoCode == ENOENT) {
      code = kFileReadNoSuchFileError;
      reason = "does not exist";
    } else if (errnoCode == EACCES) {
      code = kFileReadNoPermissionError;
      reason = "could not be read for lack of permission";
    }
    *error = Error(kFileErrorDomain, code,
                   Dictionary{{kLocalizedDescriptionKey, String(format("The file %s %s.", url.path(), reason))},
                              {kUnderlyingErrorKey, posixError}});
  }
  return nullptr;
}

}  // namespace sl
