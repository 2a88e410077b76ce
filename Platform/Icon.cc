// The icon renderer on Linux: libpng for decoding, the scaling and the
// shape done here.
//
// libpng reports errors by longjmp to the last setjmp. Every setjmp here
// sits in a small function whose own locals are all trivial, and the
// structures live in a guard owned by its caller, so a jump never skips a
// destructor and never leaves a clobbered local behind: the caller sees
// false and the guard frees the structures as it goes out of scope.

#include "Platform/Icon.h"

#include <fcntl.h>
#include <png.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <csetjmp>
#include <cstring>
#include <new>
#include <string>
#include <string_view>

#include "Platform/Bundle.h"
#include "Platform/UniqueFd.h"

namespace sl {

namespace {

// ---- Decoding ----

struct PngReadGuard {
  png_structp png = nullptr;
  png_infop info = nullptr;
  PngReadGuard() = default;
  PngReadGuard(const PngReadGuard&) = delete;
  PngReadGuard& operator=(const PngReadGuard&) = delete;
  ~PngReadGuard() {
    if (png != nullptr) png_destroy_read_struct(&png, info != nullptr ? &info : nullptr, nullptr);
  }
};

struct MemoryReader {
  const uint8_t* bytes;
  size_t size;
  size_t offset;
};

// Errors end in a jump back to the setjmp of the phase that is running;
// nothing is printed. Warnings are dropped.
[[noreturn]] void silentError(png_structp png, png_const_charp) { png_longjmp(png, 1); }
void silentWarning(png_structp, png_const_charp) {}

void readFromMemory(png_structp png, png_bytep out, png_size_t length) {
  auto* reader = static_cast<MemoryReader*>(png_get_io_ptr(png));
  if (length > reader->size - reader->offset) png_error(png, "truncated");
  std::memcpy(out, reader->bytes + reader->offset, length);
  reader->offset += length;
}

// First phase: the header, and the transformations that turn every colour
// type and depth into 8-bit RGBA. False on any libpng error.
bool readHeader(png_structp png, png_infop info, png_uint_32* width, png_uint_32* height) {
  if (setjmp(png_jmpbuf(png))) return false;
  png_read_info(png, info);
  png_set_expand(png);        // palette to RGB, low-depth grey to 8 bits, tRNS to alpha
  png_set_strip_16(png);      // 16-bit samples to 8
  png_set_gray_to_rgb(png);
  png_set_add_alpha(png, 0xff, PNG_FILLER_AFTER);  // only where there is no alpha yet
  (void)png_set_interlace_handling(png);
  png_read_update_info(png, info);
  if (png_get_bit_depth(png, info) != 8 || png_get_channels(png, info) != 4) return false;
  *width = png_get_image_width(png, info);
  *height = png_get_image_height(png, info);
  return png_get_rowbytes(png, info) == size_t{*width} * 4;
}

// Second phase: the pixels, into rows prepared by the caller.
bool readPixels(png_structp png, png_infop info, png_bytepp rows) {
  if (setjmp(png_jmpbuf(png))) return false;
  png_read_image(png, rows);
  png_read_end(png, info);
  return true;
}

// ---- Candidates ----

bool isSingleComponent(std::string_view name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string_view::npos;
}

bool hasSuffix(std::string_view name, std::string_view suffix) {
  return name.size() >= suffix.size() && name.substr(name.size() - suffix.size()) == suffix;
}

void addCandidate(std::vector<std::string>* candidates, std::string_view name) {
  if (!isSingleComponent(name)) return;
  auto add = [candidates](std::string entry) {
    if (std::find(candidates->begin(), candidates->end(), entry) == candidates->end())
      candidates->push_back(std::move(entry));
  };
  add(std::string(name));
  if (!hasSuffix(name, ".png")) add(std::string(name) + ".png");
}

std::vector<std::string> namedCandidates(const URL& bundleURL) {
  std::vector<std::string> candidates;
  const std::shared_ptr<Bundle> bundle = Bundle::createUnique(bundleURL);
  if (!bundle) return candidates;
  const Dictionary info = bundle->infoDictionary();
  for (const Value& name : info.get(kBundleIconFilesKey).asArray()) {
    const String text = name.asString();
    if (!text.isNull()) addCandidate(&candidates, text.view());
  }
  const String single = info.get(kBundleIconFileKey).asString();
  if (!single.isNull()) addCandidate(&candidates, single.view());
  return candidates;
}

// "Icon*.png" at the top of the bundle, sorted; empty when the directory
// cannot be listed.
std::vector<std::string> scannedCandidates(int bundleFd) {
  std::vector<std::string> names;
  UniqueFd listing(::openat(bundleFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!listing) return names;
  UniqueDir dir = fdopendir(listing);
  if (!dir) return names;
  for (;;) {
    errno = 0;
    const dirent* entry = ::readdir(dir.get());
    if (entry == nullptr) break;  // end or error: either way, what was read is all there is
    const std::string_view name(entry->d_name);
    if (name.starts_with("Icon") && hasSuffix(name, ".png")) names.emplace_back(name);
  }
  std::sort(names.begin(), names.end());
  return names;
}

// The bytes of a regular file in the bundle, never through a link; false
// when it cannot be opened or read, is not regular or is too large.
bool readCandidate(int bundleFd, const std::string& name, std::vector<uint8_t>* out) {
  UniqueFd fd(::openat(bundleFd, name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
  if (!fd) return false;
  struct stat st;
  if (::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode)) return false;
  if (st.st_size <= 0 || static_cast<uint64_t>(st.st_size) > kMaxIconFileSize) return false;
  std::vector<uint8_t> bytes(static_cast<size_t>(st.st_size));
  size_t used = 0;
  while (used < bytes.size()) {
    ssize_t n = ::read(fd.get(), bytes.data() + used, bytes.size() - used);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;  // an error, or the file shrank under us
    used += static_cast<size_t>(n);
  }
  *out = std::move(bytes);
  return true;
}

// ---- Scaling and shape ----

// For one axis: the source pixels each destination pixel covers, with the
// share of the destination pixel that each of them fills (the shares of
// one destination pixel add up to 1). The taps of destination pixel d are
// taps[first[d]] up to taps[first[d + 1]], in source order.
struct Tap {
  uint32_t source;
  double weight;
};

struct AxisTaps {
  std::vector<uint32_t> first;
  std::vector<Tap> taps;
};

AxisTaps areaTaps(uint32_t sourceSize, uint32_t destinationSize) {
  AxisTaps axis;
  axis.first.reserve(size_t{destinationSize} + 1);
  // Each destination pixel covers at most ceil(scale) + 1 source pixels.
  axis.taps.reserve(size_t{destinationSize} * (sourceSize / destinationSize + 2));
  const double scale = static_cast<double>(sourceSize) / destinationSize;
  for (uint32_t d = 0; d < destinationSize; ++d) {
    axis.first.push_back(static_cast<uint32_t>(axis.taps.size()));
    const double begin = d * scale;
    const double end = std::min<double>((d + 1) * scale, sourceSize);
    for (auto s = static_cast<uint32_t>(begin); s < sourceSize && s < end; ++s) {
      const double overlap = std::min<double>(end, s + 1.0) - std::max<double>(begin, s);
      if (overlap > 0) axis.taps.push_back({s, overlap / scale});
    }
  }
  axis.first.push_back(static_cast<uint32_t>(axis.taps.size()));
  return axis;
}

// Scales to size x size in premultiplied alpha; the result is premultiplied
// floats, 0 to 255 per channel, size x size x 4 of them.
//
// Both passes accumulate in doubles starting from 0.0, tap by tap in source
// order, and round to float once at the end; the vertical pass runs along
// whole rows so that it vectorises, without changing that order.
std::unique_ptr<float[]> scalePremultiplied(const Image& source, uint32_t size) {
  const AxisTaps columns = areaTaps(source.width, size);
  const size_t rowLength = size_t{size} * 4;

  // Horizontal pass: every source row to `size` premultiplied pixels.
  auto horizontal = std::make_unique_for_overwrite<float[]>(rowLength * source.height);
  for (uint32_t y = 0; y < source.height; ++y) {
    const uint8_t* in = source.pixels.data() + size_t{y} * source.width * 4;
    float* out = horizontal.get() + size_t{y} * rowLength;
    for (uint32_t x = 0; x < size; ++x) {
      double sum[4] = {0, 0, 0, 0};
      for (uint32_t t = columns.first[x]; t < columns.first[x + 1]; ++t) {
        const Tap& tap = columns.taps[t];
        const uint8_t* p = in + size_t{tap.source} * 4;
        const double alpha = p[3] * tap.weight;
        sum[0] += p[0] * alpha / 255.0;
        sum[1] += p[1] * alpha / 255.0;
        sum[2] += p[2] * alpha / 255.0;
        sum[3] += alpha;
      }
      for (int c = 0; c < 4; ++c) out[size_t{x} * 4 + c] = static_cast<float>(sum[c]);
    }
  }
  // Same height: every row has the one source row as its only tap, of
  // weight 1, and the vertical pass would give back its input unchanged.
  if (source.height == size) return horizontal;

  // Vertical pass.
  const AxisTaps rows = areaTaps(source.height, size);
  auto result = std::make_unique_for_overwrite<float[]>(rowLength * size);
  auto sum = std::make_unique_for_overwrite<double[]>(rowLength);
  for (uint32_t y = 0; y < size; ++y) {
    float* out = result.get() + size_t{y} * rowLength;
    const uint32_t firstTap = rows.first[y];
    const uint32_t lastTap = rows.first[y + 1] - 1;  // every row covers some source row
    auto sourceRow = [&](uint32_t t) -> const float* {
      return horizontal.get() + size_t{rows.taps[t].source} * rowLength;
    };
    const float* in = sourceRow(firstTap);
    double weight = rows.taps[firstTap].weight;
    if (firstTap == lastTap) {
      for (size_t i = 0; i < rowLength; ++i) out[i] = static_cast<float>(0.0 + in[i] * weight);
      continue;
    }
    for (size_t i = 0; i < rowLength; ++i) sum[i] = 0.0 + in[i] * weight;
    for (uint32_t t = firstTap + 1; t < lastTap; ++t) {
      in = sourceRow(t);
      weight = rows.taps[t].weight;
      for (size_t i = 0; i < rowLength; ++i) sum[i] += in[i] * weight;
    }
    in = sourceRow(lastTap);
    weight = rows.taps[lastTap].weight;
    for (size_t i = 0; i < rowLength; ++i) out[i] = static_cast<float>(sum[i] + in[i] * weight);
  }
  return result;
}

// Coverage of the pixel (x, y) by the rounded square of side `size`.
double shapeCoverage(uint32_t x, uint32_t y, uint32_t size) {
  const double radius = kHomeScreenIconCornerRadius * size;
  // Distance of the pixel centre from the nearer edge, on each axis.
  const double cx = std::min(x + 0.5, size - (x + 0.5));
  const double cy = std::min(y + 0.5, size - (y + 0.5));
  if (cx >= radius || cy >= radius) return 1.0;
  const double distance = std::hypot(radius - cx, radius - cy);
  return std::clamp(radius - distance + 0.5, 0.0, 1.0);
}

// The coverage of every pixel of the home-screen square, row by row,
// computed once.
const std::vector<double>& homeScreenCoverage() {
  static const std::vector<double> table = [] {
    constexpr uint32_t size = kHomeScreenIconSize;
    std::vector<double> coverage(size_t{size} * size);
    for (uint32_t y = 0; y < size; ++y)
      for (uint32_t x = 0; x < size; ++x) coverage[size_t{y} * size + x] = shapeCoverage(x, y, size);
    return coverage;
  }();
  return table;
}

// Clamped to [0, 255] and rounded half away from zero, as lround rounds,
// without its call: this runs four times per pixel. Between 0 and 255 the
// fraction value - whole is exact, so the comparison decides as lround would.
uint8_t toByte(double value) {
  if (!(value > 0.0)) return 0;  // NaN too
  if (value >= 255.0) return 255;
  const auto whole = static_cast<uint8_t>(value);
  return static_cast<uint8_t>(whole + (value - whole >= 0.5 ? 1 : 0));
}

// The home-screen shape cut out of kHomeScreenIconSize-square premultiplied
// pixels, in straight alpha.
Image shapeAndUnpremultiply(const float* premultiplied) {
  constexpr uint32_t size = kHomeScreenIconSize;
  const double* coverageOf = homeScreenCoverage().data();

  Image image;
  image.width = size;
  image.height = size;
  image.pixels.assign(size_t{size} * size * 4, 0);
  for (uint32_t y = 0; y < size; ++y) {
    double previousCoverage = -1.0;  // none yet in this row
    for (uint32_t x = 0; x < size; ++x) {
      const size_t i = (size_t{y} * size + x) * 4;
      const double coverage = coverageOf[size_t{y} * size + x];
      // A pixel whose bits equal its left neighbour's under the same coverage
      // comes out the same. Scaled-up icons and flat areas are mostly such runs.
      if (coverage == previousCoverage &&
          std::memcmp(premultiplied + i, premultiplied + (i - 4), 4 * sizeof(float)) == 0) {
        std::copy_n(image.pixels.begin() + (i - 4), 4, image.pixels.begin() + i);
        continue;
      }
      previousCoverage = coverage;
      const double alpha = premultiplied[i + 3] * coverage;
      const uint8_t alphaByte = toByte(alpha);
      if (alphaByte == 0) continue;  // transparent pixels keep colour 0
      // Coverage scales colour and alpha alike, so the straight colour is
      // the premultiplied one over the unshaped alpha.
      const double unshaped = premultiplied[i + 3];
      for (int c = 0; c < 3; ++c) image.pixels[i + c] = toByte(premultiplied[i + c] * 255.0 / unshaped);
      image.pixels[i + 3] = alphaByte;
    }
  }
  return image;
}

}  // namespace

bool decodePNG(const std::vector<uint8_t>& bytes, Image* out) {
  if (bytes.size() < 8 || png_sig_cmp(bytes.data(), 0, 8) != 0) return false;
  PngReadGuard guard;
  guard.png = png_create_read_struct(PNG_LIBPNG_VER_STRING, nullptr, silentError, silentWarning);
  if (guard.png == nullptr) return false;
  guard.info = png_create_info_struct(guard.png);
  if (guard.info == nullptr) return false;
  png_set_user_limits(guard.png, kMaxIconDimension, kMaxIconDimension);
  MemoryReader reader{bytes.data(), bytes.size(), 0};
  png_set_read_fn(guard.png, &reader, readFromMemory);

  png_uint_32 width = 0;
  png_uint_32 height = 0;
  if (!readHeader(guard.png, guard.info, &width, &height) || width == 0 || height == 0) return false;

  Image image;
  std::vector<png_bytep> rows;
  try {
    image.pixels.resize(size_t{width} * height * 4);
    rows.resize(height);
  } catch (const std::bad_alloc&) {
    return false;
  }
  for (png_uint_32 y = 0; y < height; ++y) rows[y] = image.pixels.data() + size_t{y} * width * 4;
  if (!readPixels(guard.png, guard.info, rows.data())) return false;

  image.width = width;
  image.height = height;
  *out = std::move(image);
  return true;
}

std::shared_ptr<const Image> renderHomeScreenIcon(const URL& bundle) {
  if (bundle.isNull()) return nullptr;
  // The bundle itself is opened by path, links included, as the bundle
  // facility opens it; what lies inside is reached from this descriptor only.
  UniqueFd bundleFd(::open(bundle.fileSystemRepresentation(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!bundleFd) return nullptr;

  std::vector<std::string> candidates = namedCandidates(bundle);
  if (candidates.empty()) candidates = scannedCandidates(bundleFd.get());

  // The largest by area wins; among equals the first found.
  Image best;
  for (const std::string& name : candidates) {
    std::vector<uint8_t> bytes;
    Image decoded;
    if (!readCandidate(bundleFd.get(), name, &bytes) || !decodePNG(bytes, &decoded)) continue;
    if (uint64_t{decoded.width} * decoded.height > uint64_t{best.width} * best.height) best = std::move(decoded);
  }
  if (!best.isValid()) return nullptr;

  return std::make_shared<const Image>(
      shapeAndUnpremultiply(scalePremultiplied(best, kHomeScreenIconSize).get()));
}

}  // namespace sl
