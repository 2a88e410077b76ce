// The PNG encoder, under the names the system gives its image-destination
// calls.
//
// A destination is made over a growable byte buffer for one type and a
// number of images; it takes the images, and Finalize encodes them into the
// buffer. Only "public.png" with exactly one image is supported: that is
// the one kind of file the system writes with it. The destination keeps a
// reference to the buffer, which must outlive it.
//
// Finalize appends one PNG file (8-bit RGBA, not interlaced, encoded for
// speed rather than the smallest size) to the buffer and reports success.
// It fails when no image was added, when the image is not valid
// (Image::isValid) or larger than libpng writes, when it was called before
// on the same destination, or when libpng fails; the buffer then holds what
// it held before the call. A second AddImage on a one-image destination is
// ignored.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "Platform/Icon.h"

namespace sl {

// The growable byte buffer that a destination writes into.
struct MutableDataBuffer {
  std::vector<uint8_t> bytes;
};

}  // namespace sl

inline constexpr char kUTTypePNG[] = "public.png";

struct KVImageDestination;
using KVImageDestinationRef = KVImageDestination*;

// A new destination over `data`, or null when type is not "public.png" (or
// null) or count is not 1. The caller releases it with
// KVImageDestinationRelease (or holds it in a KVImageDestinationOwner).
KVImageDestinationRef KVImageDestinationCreateWithData(sl::MutableDataBuffer& data, const char* type, size_t count);

// Adds a copy of image. A null destination is ignored.
void KVImageDestinationAddImage(KVImageDestinationRef destination, const sl::Image& image);

// Encodes the added image into the buffer; see the top of this file.
[[nodiscard]] bool KVImageDestinationFinalize(KVImageDestinationRef destination);

// Frees the destination; null is ignored. The buffer is not touched.
void KVImageDestinationRelease(KVImageDestinationRef destination);

struct KVImageDestinationReleaser {
  void operator()(KVImageDestinationRef destination) const { KVImageDestinationRelease(destination); }
};
using KVImageDestinationOwner = std::unique_ptr<KVImageDestination, KVImageDestinationReleaser>;
