// The PNG encoder on Linux: libpng writing into the destination's buffer
// through a write function of our own.
//
// As in the decoder (Icon.cc), the setjmp sits in a function whose locals
// are all trivial and the libpng structures belong to a guard in its
// caller, so an error jump skips no destructor.

#include "Platform/ImageDestination.h"

#include <png.h>

#include <csetjmp>
#include <cstring>
#include <new>
#include <optional>

struct KVImageDestination {
  sl::MutableDataBuffer* data;
  std::optional<sl::Image> image;
  bool finalized = false;
};

namespace {

struct PngWriteGuard {
  png_structp png = nullptr;
  png_infop info = nullptr;
  PngWriteGuard() = default;
  PngWriteGuard(const PngWriteGuard&) = delete;
  PngWriteGuard& operator=(const PngWriteGuard&) = delete;
  ~PngWriteGuard() {
    if (png != nullptr) png_destroy_write_struct(&png, info != nullptr ? &info : nullptr);
  }
};

[[noreturn]] void silentError(png_structp png, png_const_charp) { png_longjmp(png, 1); }
void silentWarning(png_structp, png_const_charp) {}

void appendToBuffer(png_structp png, png_bytep bytes, png_size_t length) {
  auto* buffer = static_cast<std::vector<uint8_t>*>(png_get_io_ptr(png));
  bool grown = true;
  try {
    buffer->insert(buffer->end(), bytes, bytes + length);
  } catch (const std::bad_alloc&) {
    grown = false;
  }
  // Outside the handler: the jump must not leave a live exception behind.
  if (!grown) png_error(png, "out of memory");
}

void flushNothing(png_structp) {}

// Speed over size: with libpng's defaults (every filter tried on every
// row, deflate level 6) the encoding costs more than rendering the icon.
// One filter, Up, and level 2 are several times faster, and the file stays
// within about a third of the default size, for flat icons (scaled-up rows
// repeat, and Up makes them zeros) and for gradients alike.
constexpr int kCompressionLevel = 2;

bool writeImage(png_structp png, png_infop info, const sl::Image& image, png_bytepp rows) {
  if (setjmp(png_jmpbuf(png))) return false;
  png_set_filter(png, PNG_FILTER_TYPE_BASE, PNG_FILTER_UP);
  png_set_compression_level(png, kCompressionLevel);
  png_set_IHDR(png, info, image.width, image.height, 8, PNG_COLOR_TYPE_RGB_ALPHA, PNG_INTERLACE_NONE,
               PNG_COMPRESSION_TYPE_DEFAULT, PNG_FILTER_TYPE_DEFAULT);
  png_write_info(png, info);
  png_write_image(png, rows);
  png_write_end(png, info);
  return true;
}

// Appends the PNG form of image to *out; on failure *out is as it was.
bool encodePNG(const sl::Image& image, std::vector<uint8_t>* out) {
  if (!image.isValid() || image.width > PNG_USER_WIDTH_MAX || image.height > PNG_USER_HEIGHT_MAX) return false;
  PngWriteGuard guard;
  guard.png = png_create_write_struct(PNG_LIBPNG_VER_STRING, nullptr, silentError, silentWarning);
  if (guard.png == nullptr) return false;
  guard.info = png_create_info_struct(guard.png);
  if (guard.info == nullptr) return false;

  std::vector<png_bytep> rows;
  try {
    rows.resize(image.height);
  } catch (const std::bad_alloc&) {
    return false;
  }
  // libpng only reads the rows it is given; the casts drop a const that its
  // interface lacks.
  auto* pixels = const_cast<uint8_t*>(image.pixels.data());
  for (uint32_t y = 0; y < image.height; ++y) rows[y] = pixels + size_t{y} * image.width * 4;

  const size_t before = out->size();
  png_set_write_fn(guard.png, out, appendToBuffer, flushNothing);
  if (!writeImage(guard.png, guard.info, image, rows.data())) {
    out->resize(before);
    return false;
  }
  return true;
}

}  // namespace

KVImageDestinationRef KVImageDestinationCreateWithData(sl::MutableDataBuffer& data, const char* type, size_t count) {
  if (type == nullptr || std::strcmp(type, kUTTypePNG) != 0 || count != 1) return nullptr;
  return new (std::nothrow) KVImageDestination{&data, std::nullopt, false};
}

void KVImageDestinationAddImage(KVImageDestinationRef destination, const sl::Image& image) {
  if (destination == nullptr || destination->image.has_value()) return;
  destination->image = image;
}

bool KVImageDestinationFinalize(KVImageDestinationRef destination) {
  if (destination == nullptr || destination->finalized || !destination->image.has_value()) return false;
  destination->finalized = true;
  return encodePNG(*destination->image, &destination->data->bytes);
}

void KVImageDestinationRelease(KVImageDestinationRef destination) { delete destination; }
