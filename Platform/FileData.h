// The platform's whole-file read, as its data object does it.
#pragma once

#include "Platform/Error.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

namespace sl {

// The bytes of the file at url, read whole without caching; a non-null Data
// (possibly empty) on success. On failure null, and *error (when given) is a
// record of kFileErrorDomain: kFileReadNoSuchFileError when nothing stands at
// the path (ENOENT), kFileReadNoPermissionError when access is refused
// (EACCES), kFileReadUnknownError for anything else; its message names the
// path and the reason, and kUnderlyingErrorKey holds the POSIX record of the
// failed call.
Data dataWithContentsOfURL(const URL& url, Error* error = nullptr);

}  // namespace sl
