// Property lists: reading and writing values as XML and binary ("bplist00").
//
// Readers take a whole file's bytes and tell the two formats apart by the
// binary magic. Both are safe on hostile input: the XML reader never fetches
// a DOCTYPE's external subset and bounds entity expansion; the binary reader
// checks every offset and reference against the file, refuses object cycles
// and nesting deeper than kMaxPropertyListDepth, and never reads past the
// buffer. Every refusal is an error record, never a crash or a hang.
//
// Writers produce XML with the XML declaration and a <plist version="1.0">
// root element and no DOCTYPE, or binary. URL and Error values have no
// property-list form and are refused (EINVAL). A string that is not valid
// UTF-8 is refused by the XML writer (EILSEQ); the binary writer keeps its
// bytes, writing each byte that is not part of valid UTF-8 as the lone
// UTF-16 code unit 0xDC00 + byte, which the binary reader turns back into
// that byte.
//
// Choices where the formats leave room (details at the top of
// PropertyListXML.cc and PropertyListBinary.cc):
//   - XML: the root element must be <plist> holding one value; documents
//     that declare entities are refused (property lists never need them);
//     a repeated dictionary key keeps its last value; data is written as
//     one line of base64 and dates to the whole second.
//   - Binary: null, fill and UID objects are refused, sets are read as
//     arrays, 16-byte integers are read when they fit 64 bits; objects
//     shared by several containers are parsed once, so sharing never
//     multiplies the work of reading. (The writers do not share
//     containers: such a value is written out unfolded, in full.)
//   - At most kMaxPropertyListDepth arrays and dictionaries nest one inside
//     another, in reading and in writing alike.
//
// Failures are POSIX records: EINVAL for malformed input, with a message
// that says what was wrong and where, EILSEQ for text that cannot be
// encoded, and the errno of the failing call for file access.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/Error.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

namespace sl {

enum class PropertyListFormat { XML, Binary };

inline constexpr int kMaxPropertyListDepth = 512;

// Parses a whole property list. Returns null and fills *error on failure.
Value propertyListFromData(std::span<const uint8_t> bytes, Error* error = nullptr,
                           PropertyListFormat* formatOut = nullptr);

// Serialises a value. Returns false and fills *error on failure.
bool dataFromPropertyList(const Value& value, PropertyListFormat format, std::vector<uint8_t>* out,
                          Error* error = nullptr);

// Reads the whole file at url, a regular file of at most kLargestFileRead
// bytes. Returns the bytes, or false with a POSIX record (errno of open,
// fstat or read; EFBIG for a larger file).
inline constexpr size_t kLargestFileRead = size_t{64} << 20;
bool readFileContents(const URL& url, std::vector<uint8_t>* out, Error* error = nullptr);

// The dictionary stored in the property-list file at url; null when the
// file is missing, unreadable, malformed or holds something other than a
// dictionary.
Dictionary dictionaryWithContentsOfURL(const URL& url);

// Writes a value to url atomically (see AtomicFile.h): the file holds either
// its old content or the whole new one, whatever happens.
bool writePropertyListToURL(const Value& value, const URL& url, PropertyListFormat format = PropertyListFormat::XML,
                            Error* error = nullptr);

// The pieces behind the calls above, shared by the three files of the codec.
namespace plist_detail {

Value parseXML(std::span<const uint8_t> bytes, Error* error);
Value parseBinary(std::span<const uint8_t> bytes, Error* error);
bool writeXML(const Value& value, std::vector<uint8_t>* out, Error* error);
bool writeBinary(const Value& value, std::vector<uint8_t>* out, Error* error);

// Decodes the well-formed UTF-8 sequence at text[*i] (no overlong forms, no
// surrogates, nothing above U+10FFFF), advances *i past it and answers its
// code point; answers -1 and advances *i by one byte when the byte there
// does not begin one.
int32_t decodeUTF8(std::string_view text, size_t* i);
void appendUTF8(std::string* out, uint32_t codePoint);

// Fills *error (when given) with a POSIX record and answers false.
bool fail(Error* error, int code, std::string message);

}  // namespace plist_detail

}  // namespace sl
