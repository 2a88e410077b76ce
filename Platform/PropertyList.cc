#include "Platform/PropertyList.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "Platform/AtomicFile.h"
#include "Platform/Format.h"
#include "Platform/UniqueFd.h"

namespace sl {

namespace plist_detail {

int32_t decodeUTF8(std::string_view text, size_t* i) {
  auto byte = [&](size_t k) { return static_cast<uint8_t>(text[k]); };
  size_t at = *i;
  uint8_t b0 = byte(at);
  if (b0 < 0x80) {
    *i = at + 1;
    return b0;
  }
  size_t length;
  uint32_t cp;
  uint8_t lo = 0x80, hi = 0xBF;  // the range of the second byte
  if (b0 >= 0xC2 && b0 <= 0xDF) {
    length = 2;
    cp = b0 & 0x1F;
  } else if (b0 >= 0xE0 && b0 <= 0xEF) {
    length = 3;
    cp = b0 & 0x0F;
    if (b0 == 0xE0) lo = 0xA0;  // overlong
    if (b0 == 0xED) hi = 0x9F;  // surrogates
  } else if (b0 >= 0xF0 && b0 <= 0xF4) {
    length = 4;
    cp = b0 & 0x07;
    if (b0 == 0xF0) lo = 0x90;  // overlong
    if (b0 == 0xF4) hi = 0x8F;  // above U+10FFFF
  } else {
    *i = at + 1;
    return -1;
  }
  if (text.size() - at < length) {
    *i = at + 1;
    return -1;
  }
  for (size_t k = 1; k < length; ++k) {
    uint8_t b = byte(at + k);
    if (b < (k == 1 ? lo : 0x80) || b > (k == 1 ? hi : 0xBF)) {
      *i = at + 1;
      return -1;
    }
    cp = (cp << 6) | (b & 0x3F);
  }
  *i = at + length;
  return static_cast<int32_t>(cp);
}

void appendUTF8(std::string* out, uint32_t cp) {
  if (cp < 0x80) {
    out->push_back(static_cast<char>(cp));
  } else if (cp < 0x800) {
    out->push_back(static_cast<char>(0xC0 | (cp >> 6)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  } else if (cp < 0x10000) {
    out->push_back(static_cast<char>(0xE0 | (cp >> 12)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  } else {
    out->push_back(static_cast<char>(0xF0 | (cp >> 18)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 12) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | ((cp >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (cp & 0x3F)));
  }
}

bool fail(Error* error, int code, std::string message) {
  if (error) *error = Error::posix(code, message);
  return false;
}

}  // namespace plist_detail

namespace {

constexpr std::string_view kBinaryPrefix = "bplist";

std::string errnoText(int code) {
  char buf[256];
  return strerror_r(code, buf, sizeof buf);  // the GNU form answers the text
}

}  // namespace

Value propertyListFromData(std::span<const uint8_t> bytes, Error* error, PropertyListFormat* formatOut) {
  // Anything that starts like a binary list is read as one (so a damaged
  // binary file is reported as such, not as malformed XML).
  bool binary = bytes.size() >= kBinaryPrefix.size() &&
                std::equal(kBinaryPrefix.begin(), kBinaryPrefix.end(), bytes.begin());
  PropertyListFormat format = binary ? PropertyListFormat::Binary : PropertyListFormat::XML;
  Value value = binary ? plist_detail::parseBinary(bytes, error) : plist_detail::parseXML(bytes, error);
  if (value && formatOut) *formatOut = format;
  return value;
}

bool dataFromPropertyList(const Value& value, PropertyListFormat format, std::vector<uint8_t>* out, Error* error) {
  std::vector<uint8_t> bytes;
  bool ok = format == PropertyListFormat::Binary ? plist_detail::writeBinary(value, &bytes, error)
                                                 : plist_detail::writeXML(value, &bytes, error);
  if (ok) *out = std::move(bytes);
  return ok;
}

bool readFileContents(const URL& url, std::vector<uint8_t>* out, Error* error) {
  const std::string& path = url.path();
  // O_NONBLOCK: a fifo planted where a file is expected must not hang the
  // open (it is refused below); O_NOCTTY: a terminal never becomes ours.
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!fd) {
    int e = errno;
    return plist_detail::fail(error, e, format("open of %s failed: %s", path, errnoText(e)));
  }
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) {
    int e = errno;
    return plist_detail::fail(error, e, format("fstat of %s failed: %s", path, errnoText(e)));
  }
  // Only regular files are read: a directory is refused as read(2) would
  // refuse it, and a fifo, socket or device (which could block or never
  // end) is not read at all.
  if (S_ISDIR(st.st_mode)) {
    return plist_detail::fail(error, EISDIR, format("read of %s failed: %s", path, errnoText(EISDIR)));
  }
  if (!S_ISREG(st.st_mode)) {
    return plist_detail::fail(error, EINVAL, format("read of %s failed: not a regular file", path));
  }
  // Nothing read whole here comes near the limit (property lists, store
  // metadata, os-release); a file past it (a sparse one of any claimed size)
  // is refused rather than exhaust memory.
  const auto tooLarge = [&] {
    return plist_detail::fail(error, EFBIG, format("read of %s failed: %s", path, errnoText(EFBIG)));
  };
  if (st.st_size > static_cast<off_t>(kLargestFileRead)) return tooLarge();
  std::vector<uint8_t> bytes;
  // The size is a hint only: files of /proc and the like report 0, and a
  // file may grow or shrink while it is read. Read until end of file.
  // One byte more than the size lets the read that sees end of file land in
  // the buffer without growing it.
  if (st.st_size > 0) bytes.resize(static_cast<size_t>(st.st_size) + 1);
  size_t used = 0;
  for (;;) {
    if (used == bytes.size()) {
      if (used > kLargestFileRead) return tooLarge();
      bytes.resize(bytes.size() + std::max<size_t>(65536, bytes.size() / 2));
    }
    ssize_t n = ::read(fd.get(), bytes.data() + used, bytes.size() - used);
    if (n < 0) {
      int e = errno;
      if (e == EINTR) continue;
      return plist_detail::fail(error, e, format("read of %s failed: %s", path, errnoText(e)));
    }
    if (n == 0) break;
    used += static_cast<size_t>(n);
  }
  bytes.resize(used);
  *out = std::move(bytes);
  return true;
}

Dictionary dictionaryWithContentsOfURL(const URL& url) {
  std::vector<uint8_t> bytes;
  if (!readFileContents(url, &bytes)) return nullptr;
  return propertyListFromData(bytes).asDictionary();
}

bool writePropertyListToURL(const Value& value, const URL& url, PropertyListFormat format, Error* error) {
  std::vector<uint8_t> bytes;
  if (!dataFromPropertyList(value, format, &bytes, error)) return false;
  return writeFileAtomically(url, bytes, 0644, error);
}

}  // namespace sl
