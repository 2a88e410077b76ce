#include "Platform/Icon.h"

#include <gtest/gtest.h>
#include <png.h>

#include <array>
#include <string>
#include <vector>

#include "Platform/ImageDestination.h"
#include "Platform/PropertyList.h"
#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

using Pixel = std::array<uint8_t, 4>;

Image solid(uint32_t width, uint32_t height, Pixel colour) {
  Image image{width, height, {}};
  for (size_t i = 0; i < size_t{width} * height; ++i) image.pixels.insert(image.pixels.end(), colour.begin(), colour.end());
  return image;
}

std::vector<uint8_t> encode(const Image& image) {
  MutableDataBuffer buffer;
  KVImageDestinationOwner destination(KVImageDestinationCreateWithData(buffer, "public.png", 1));
  EXPECT_TRUE(destination);
  KVImageDestinationAddImage(destination.get(), image);
  EXPECT_TRUE(KVImageDestinationFinalize(destination.get()));
  return buffer.bytes;
}

void writeBytes(const std::string& path, const std::vector<uint8_t>& bytes) {
  test::writeFile(path, std::string(bytes.begin(), bytes.end()));
}

// Decodes with libpng's own simplified reader, independent of decodePNG.
Image decodeIndependently(const std::vector<uint8_t>& bytes) {
  png_image reader{};
  reader.version = PNG_IMAGE_VERSION;
  if (!png_image_begin_read_from_memory(&reader, bytes.data(), bytes.size())) return {};
  reader.format = PNG_FORMAT_RGBA;
  Image image{reader.width, reader.height, std::vector<uint8_t>(PNG_IMAGE_SIZE(reader))};
  if (!png_image_finish_read(&reader, nullptr, image.pixels.data(), 0, nullptr)) return {};
  return image;
}

Pixel at(const Image& image, uint32_t x, uint32_t y) {
  const uint8_t* p = image.pixels.data() + (size_t{y} * image.width + x) * 4;
  return {p[0], p[1], p[2], p[3]};
}

// A PNG of any colour type written with libpng directly, every byte of
// every row `fill`, with a one-entry palette for palette images.
std::vector<uint8_t> rawPng(uint32_t size, int colourType, int depth, int interlace, uint8_t fill) {
  std::vector<uint8_t> out;
  png_structp png = png_create_write_struct(PNG_LIBPNG_VER_STRING, nullptr, nullptr, nullptr);
  png_infop info = png_create_info_struct(png);
  png_set_write_fn(png, &out, [](png_structp p, png_bytep b, png_size_t n) {
    auto* v = static_cast<std::vector<uint8_t>*>(png_get_io_ptr(p));
    v->insert(v->end(), b, b + n);
  }, nullptr);
  png_set_IHDR(png, info, size, size, depth, colourType, interlace, PNG_COMPRESSION_TYPE_DEFAULT,
               PNG_FILTER_TYPE_DEFAULT);
  png_color entry{30, 60, 90};
  if (colourType == PNG_COLOR_TYPE_PALETTE) png_set_PLTE(png, info, &entry, 1);
  png_write_info(png, info);
  std::vector<uint8_t> row(size * 8, fill);
  std::vector<png_bytep> rows(size, row.data());
  png_write_image(png, rows.data());
  png_write_end(png, info);
  png_destroy_write_struct(&png, &info);
  return out;
}

void writeInfoPlist(const std::string& bundle, const Dictionary& info) {
  ASSERT_TRUE(writePropertyListToURL(info, URL::fileURLWithPath(bundle + "/Info.plist", false)));
}

URL dirURL(const std::string& path) { return URL::fileURLWithPath(path, true); }

TEST(Icon, RendersToTheHomeScreenShapeAndEncodes) {
  test::TempDir tmp;
  const Pixel colour{200, 100, 50, 255};
  // ---- A large source named without extension, and a small one found by
  // the Icon*.png scan (no Info.plist) ----
  writeBytes(tmp / "Large.app/Icon-Large.png", encode(solid(1024, 1024, colour)));
  writeInfoPlist(tmp / "Large.app", Dictionary{{kBundleIconFileKey, String("Icon-Large")}});
  writeBytes(tmp / "Small.app/Icon.png", encode(solid(57, 57, colour)));

  for (const char* name : {"Large.app", "Small.app"}) {
    SCOPED_TRACE(name);
    std::shared_ptr<const Image> icon = renderHomeScreenIcon(dirURL(tmp / name));
    ASSERT_TRUE(icon);
    const Image decoded = decodeIndependently(encode(*icon));
    ASSERT_EQ(decoded.width, 120u);
    ASSERT_EQ(decoded.height, 120u);
    for (auto [x, y] : {std::pair{0u, 0u}, {119u, 0u}, {0u, 119u}, {119u, 119u}})
      EXPECT_EQ(at(decoded, x, y), (Pixel{0, 0, 0, 0})) << x << "," << y;
    EXPECT_EQ(at(decoded, 60, 60), colour);
    EXPECT_EQ(at(decoded, 60, 0), colour);  // only the corners are cut
    int partial = 0;
    for (uint32_t x = 0; x < 60; ++x) partial += at(decoded, x, 0).at(3) % 255 != 0;
    EXPECT_GT(partial, 0) << "the corner edge is anti-aliased";
  }

  // ---- Premultiplied scaling: the colour of transparent neighbours does
  // not bleed into the edge ----
  Image half = solid(100, 100, colour);
  const Pixel invisible{0, 0, 255, 0};
  for (uint32_t y = 0; y < 100; ++y)
    for (uint32_t x = 0; x < 51; ++x) std::copy(invisible.begin(), invisible.end(), half.pixels.begin() + (y * 100 + x) * 4);
  writeBytes(tmp / "Half.app/Icon.png", encode(half));
  std::shared_ptr<const Image> fringe = renderHomeScreenIcon(dirURL(tmp / "Half.app"));
  ASSERT_TRUE(fringe);
  const Pixel edge = at(*fringe, 61, 60);  // covers source columns 50.8 to 51.7
  EXPECT_GT(edge[3], 0);
  EXPECT_LT(edge[3], 255);
  EXPECT_EQ((Pixel{edge[0], edge[1], edge[2], 255}), colour);
}

TEST(Icon, SameSizeSourceMatchesTheScaledPath) {
  // A source already 120 pixels high skips the vertical pass. The same
  // picture at twice the size, each pixel a 2 x 2 block, goes through both
  // passes with weights of exactly one half and must come out identical.
  test::TempDir tmp;
  Image same{120, 120, {}};
  Image doubled{240, 240, std::vector<uint8_t>(size_t{240} * 240 * 4)};
  uint32_t seed = 12345;
  for (uint32_t i = 0; i < 120 * 120; ++i) {
    seed = seed * 1103515245 + 12345;
    const Pixel p{uint8_t(seed >> 8), uint8_t(seed >> 16), uint8_t(seed >> 24), uint8_t(i % 7 == 0 ? 0 : seed >> 4)};
    same.pixels.insert(same.pixels.end(), p.begin(), p.end());
    const uint32_t x = i % 120 * 2;
    const uint32_t y = i / 120 * 2;
    for (uint32_t row : {y, y + 1})
      for (uint32_t column : {x, x + 1})
        std::copy(p.begin(), p.end(), doubled.pixels.begin() + (size_t{row} * 240 + column) * 4);
  }
  writeBytes(tmp / "Same.app/Icon.png", encode(same));
  writeBytes(tmp / "Doubled.app/Icon.png", encode(doubled));
  std::shared_ptr<const Image> direct = renderHomeScreenIcon(dirURL(tmp / "Same.app"));
  std::shared_ptr<const Image> scaled = renderHomeScreenIcon(dirURL(tmp / "Doubled.app"));
  ASSERT_TRUE(direct);
  ASSERT_TRUE(scaled);
  EXPECT_TRUE(direct->pixels == scaled->pixels);
  // Away from the corners the source comes back unchanged, colour 0 where
  // it is transparent.
  for (uint32_t y = 30; y < 90; ++y)
    for (uint32_t x = 30; x < 90; ++x) {
      const Pixel source = at(same, x, y);
      const Pixel expected = source[3] == 0 ? Pixel{0, 0, 0, 0} : source;
      ASSERT_EQ(at(*direct, x, y), expected) << x << "," << y;
    }
}

TEST(Icon, CandidateChoice) {
  test::TempDir tmp;
  const std::vector<uint8_t> valid = encode(solid(64, 64, {0, 0, 255, 255}));
  // ---- The largest decodable candidate wins; corrupt ones are passed over ----
  const std::string app = tmp / "Choice.app";
  writeBytes(app + "/Truncated.png", std::vector<uint8_t>(valid.begin(), valid.begin() + valid.size() / 2));
  writeBytes(app + "/Small.png", encode(solid(57, 57, {255, 0, 0, 255})));
  test::writeFile(app + "/Garbage", "\x89PNG\r\n\x1a\n not really");
  writeBytes(app + "/Big.png", encode(solid(114, 114, {0, 255, 0, 255})));
  writeInfoPlist(app, Dictionary{{kBundleIconFilesKey, Array{String("Truncated.png"), String("Small"),
                                                             String("Garbage"), String("../Outside.png")}},
                                 {kBundleIconFileKey, String("Big.png")}});
  writeBytes(tmp / "Outside.png", encode(solid(512, 512, {9, 9, 9, 255})));
  std::shared_ptr<const Image> icon = renderHomeScreenIcon(dirURL(app));
  ASSERT_TRUE(icon);
  EXPECT_EQ(at(*icon, 60, 60), (Pixel{0, 255, 0, 255}));

  // ---- Nothing decodes: null ----
  test::forceRemove(app + "/Small.png");
  test::forceRemove(app + "/Big.png");
  EXPECT_FALSE(renderHomeScreenIcon(dirURL(app)));

  // ---- A link named Icon.png is never read, wherever it points ----
  test::makeSymlink(tmp / "Outside.png", tmp / "Link.app/Icon.png");
  EXPECT_FALSE(renderHomeScreenIcon(dirURL(tmp / "Link.app")));
  EXPECT_FALSE(renderHomeScreenIcon(dirURL(tmp / "Missing.app")));
}

TEST(Icon, DecodesEveryColourType) {
  struct Case {
    const char* name;
    int colourType, depth, interlace;
    uint8_t fill;
    Pixel expected;
  };
  const Case cases[] = {
      {"palette, interlaced", PNG_COLOR_TYPE_PALETTE, 8, PNG_INTERLACE_ADAM7, 0, {30, 60, 90, 255}},
      {"grey 16-bit", PNG_COLOR_TYPE_GRAY, 16, PNG_INTERLACE_NONE, 0x80, {0x80, 0x80, 0x80, 255}},
      {"grey 1-bit", PNG_COLOR_TYPE_GRAY, 1, PNG_INTERLACE_NONE, 0xff, {255, 255, 255, 255}},
      {"RGB 16-bit", PNG_COLOR_TYPE_RGB, 16, PNG_INTERLACE_ADAM7, 0x20, {0x20, 0x20, 0x20, 255}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    Image image;
    ASSERT_TRUE(decodePNG(rawPng(9, c.colourType, c.depth, c.interlace, c.fill), &image));
    ASSERT_EQ(image.width, 9u);
    EXPECT_EQ(at(image, 8, 8), c.expected);
  }
}

TEST(ImageDestination, RefusesWhatItCannotWrite) {
  MutableDataBuffer buffer;
  EXPECT_EQ(KVImageDestinationCreateWithData(buffer, "public.jpeg", 1), nullptr);
  EXPECT_EQ(KVImageDestinationCreateWithData(buffer, "public.png", 2), nullptr);

  buffer.bytes = {1, 2, 3};
  KVImageDestinationOwner empty(KVImageDestinationCreateWithData(buffer, "public.png", 1));
  ASSERT_TRUE(empty);
  EXPECT_FALSE(KVImageDestinationFinalize(empty.get()));  // no image
  KVImageDestinationOwner invalid(KVImageDestinationCreateWithData(buffer, "public.png", 1));
  KVImageDestinationAddImage(invalid.get(), Image{2, 2, {0, 0, 0}});
  EXPECT_FALSE(KVImageDestinationFinalize(invalid.get()));
  EXPECT_EQ(buffer.bytes, (std::vector<uint8_t>{1, 2, 3}));
}

}  // namespace
}  // namespace sl
