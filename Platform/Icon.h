// The icon renderer: the application's icon in the size and form that the
// home screen shows.
//
// The renderer looks for the bundle's icon files, decodes every candidate
// it finds, keeps the largest, scales it to kHomeScreenIconSize square and
// cuts the home-screen shape (rounded corners with an anti-aliased edge)
// out of it.
//
// Candidates, in this order:
//   - each name of the info dictionary's kBundleIconFilesKey (an array of
//     strings), then the name under kBundleIconFileKey (a string);
//   - only when those keys name nothing: every file at the bundle's top
//     whose name begins with "Icon" and ends with ".png" (case as written),
//     in byte order of their names.
// A name is tried as written and, when it does not already end in ".png",
// also with ".png" appended. Only single-component names are honoured (a
// name holding a '/' or equal to "." or ".." is skipped), and each file is
// opened relative to the bundle directory with O_NOFOLLOW: a link in the
// bundle, wherever it points, is never read. Files that are not regular,
// larger than kMaxIconFileSize or that fail to decode are passed over.
//
// Scaling is area averaging in premultiplied alpha: each destination pixel
// is the mean of the source area it covers, every source pixel weighted by
// the part of it that lies inside, so transparent pixels lend no colour to
// their neighbours. When the source is smaller than the destination the
// same rule degenerates to nearest neighbour, with the one destination pixel
// that straddles two source pixels taking an area-weighted blend of them.
//
// The shape: a corner radius of kHomeScreenIconCornerRadius times the size;
// inside a corner square each pixel's coverage is 0.5 plus the distance of
// its centre inside the corner circle, clamped to [0, 1] (a one-pixel
// ramp), and its alpha is multiplied by that coverage. The outermost corner
// pixels are fully transparent.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "Platform/URL.h"

namespace sl {

inline constexpr char kBundleIconFilesKey[] = "PBBundleIconFiles";
inline constexpr char kBundleIconFileKey[] = "PBBundleIconFile";

inline constexpr uint32_t kHomeScreenIconSize = 120;
inline constexpr double kHomeScreenIconCornerRadius = 0.225;

// Icon files above this size are not read: no icon needs more, and the
// decoder's memory stays bounded by it and by kMaxIconDimension.
inline constexpr size_t kMaxIconFileSize = size_t{16} << 20;
inline constexpr uint32_t kMaxIconDimension = 4096;

// An 8-bit RGBA image: rows top to bottom, each pixel four bytes R, G, B, A,
// no padding between rows. Colours are straight (not premultiplied) alpha,
// as PNG stores them. (The renderer's pixels of alpha 0 have colour 0.)
struct Image {
  uint32_t width = 0;
  uint32_t height = 0;
  std::vector<uint8_t> pixels;

  // Non-empty and pixels holding exactly width x height x 4 bytes.
  bool isValid() const {
    return width > 0 && height > 0 && pixels.size() == size_t{width} * height * 4;
  }
};

// A new kHomeScreenIconSize-square image of the bundle's icon, or null when
// the bundle cannot be opened or none of its candidates decodes.
std::shared_ptr<const Image> renderHomeScreenIcon(const URL& bundle);

// Decodes a whole PNG file's bytes (any colour type and bit depth) into an
// RGBA8 image. False for a corrupt, truncated or oversized (beyond
// kMaxIconDimension) image; *out is then untouched.
bool decodePNG(const std::vector<uint8_t>& bytes, Image* out);

}  // namespace sl
