#include "platform/imaging/IconImage.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <string>
#include <string_view>

#include "platform/imaging/ImageDestination.h"
#include "platform/imaging/SvgRenderer.h"

namespace cindral {
namespace {

Bytes bytesOf(std::string_view text) {
    const ByteView view = std::as_bytes(std::span(text));
    return {view.begin(), view.end()};
}

using Pixel = std::vector<std::uint8_t>;

Pixel pixelOf(const IconImage& image, unsigned x, unsigned y) {
    const auto at = image.pixels.begin() + static_cast<std::ptrdiff_t>((std::size_t{y} * image.width + x) * 4);
    return {at, at + 4};
}

IconImage filled(unsigned width, unsigned height, const Pixel& pixel) {
    IconImage image{width, height, {}};
    for (std::size_t i = 0; i < std::size_t{width} * height; ++i)
        image.pixels.insert(image.pixels.end(), pixel.begin(), pixel.end());
    return image;
}

Bytes pngOf(IconImage image) {
    Bytes data;
    const auto destination = ImageDestination::create(data, kPngTypeIdentifier, 1);
    destination->addImage(std::move(image));
    EXPECT_TRUE(destination->finalize());
    return data;
}

const Pixel kRed{255, 0, 0, 255};
const Pixel kNothing{0, 0, 0, 0};

TEST(DecodePng, readsWhatWasWritten) {
    IconImage image = filled(3, 2, {10, 20, 30, 40});
    image.pixels[4] = 77;
    const Bytes data = pngOf(image);
    EXPECT_TRUE(isPng(data));
    const auto back = decodePng(data);
    ASSERT_TRUE(back.ok());
    EXPECT_EQ(back->width, 3U);
    EXPECT_EQ(back->height, 2U);
    EXPECT_EQ(back->pixels, image.pixels);
}

TEST(DecodePng, refusesEveryTruncation) {
    const Bytes data = pngOf(filled(8, 8, kRed));
    // What follows the pixels may be missing.
    std::size_t refused = 0;
    for (std::size_t size = 0; size < data.size(); ++size) {
        const auto image = decodePng(ByteView(data).first(size));
        if (!image.ok()) ++refused;
    }
    EXPECT_GE(refused, data.size() - 12);
    EXPECT_TRUE(decodePng(bytesOf("no picture")).error().isPosix(EINVAL));
}

TEST(DecodePng, takesOrRefusesEveryFlippedBit) {
    const Bytes data = pngOf(filled(4, 4, kRed));
    for (std::size_t bit = 0; bit < data.size() * 8; ++bit) {
        Bytes bad = data;
        bad[bit / 8] ^= std::byte{static_cast<unsigned char>(1 << (bit % 8))};
        const auto image = decodePng(bad);
        if (image.ok()) {
            EXPECT_EQ(image->pixels.size(), std::size_t{image->width} * image->height * 4);
        }
    }
}

// A head that promises four thousand million pixels.
TEST(DecodePng, refusesAHugePictureByItsHead) {
    Bytes data = pngOf(filled(1, 1, kRed));
    for (const std::size_t at : {16U, 20U}) {
        data[at] = std::byte{0};
        data[at + 1] = std::byte{1};
    }
    // The checksum of the head, so that it is the size alone that is refused.
    std::uint32_t sum = 0xFFFF'FFFF;
    for (std::size_t i = 12; i < 29; ++i) {
        sum ^= std::to_integer<std::uint32_t>(data[i]);
        for (int bit = 0; bit < 8; ++bit) sum = (sum >> 1) ^ ((sum & 1) != 0 ? 0xEDB8'8320U : 0U);
    }
    for (std::size_t i = 0; i < 4; ++i) data[29 + i] = static_cast<std::byte>(~sum >> (24 - 8 * i));
    EXPECT_TRUE(decodePng(data).error().isPosix(EFBIG));
}

TEST(ScaledDown, keepsWhatIsSmallEnough) {
    EXPECT_EQ(scaledDown(filled(48, 20, kRed), 48).width, 48U);
    EXPECT_EQ(scaledDown(filled(4, 4, kRed), 48).width, 4U);
}

TEST(ScaledDown, keepsTheShape) {
    const IconImage image = scaledDown(filled(200, 100, kRed), 50);
    EXPECT_EQ(image.width, 50U);
    EXPECT_EQ(image.height, 25U);
    EXPECT_EQ(pixelOf(image, 49, 24), kRed);
    const IconImage line = scaledDown(filled(1000, 1, kRed), 10);
    EXPECT_EQ(line.width, 10U);
    EXPECT_EQ(line.height, 1U);
}

TEST(ScaledDown, averagesByOpacity) {
    IconImage image = filled(2, 1, {200, 100, 0, 255});
    image.pixels[4] = 0, image.pixels[5] = 0, image.pixels[6] = 0, image.pixels[7] = 0;
    EXPECT_EQ(pixelOf(scaledDown(image, 1), 0, 0), (Pixel{200, 100, 0, 128}));
}

// Images that are written

TEST(ImageDestination, writesOneImageOfItsType) {
    Bytes data;
    EXPECT_EQ(ImageDestination::create(data, "image/jpeg", 1), nullptr);
    EXPECT_EQ(ImageDestination::create(data, kPngTypeIdentifier, 2), nullptr);
    const auto none = ImageDestination::create(data, kPngTypeIdentifier, 1);
    EXPECT_FALSE(none->finalize());
    EXPECT_TRUE(data.empty());
    const auto broken = ImageDestination::create(data, kPngTypeIdentifier, 1);
    broken->addImage(IconImage{2, 2, {1, 2, 3}});
    EXPECT_FALSE(broken->finalize());
}

// Drawings

class SvgRendererTest : public ::testing::Test {
protected:
    SvgRendererTest() { setSvgRendererProgram(CINDRAL_RENDER_SVG); }
    ~SvgRendererTest() override { setSvgRendererProgram({}); }

    static std::string svg(std::string_view contents) {
        return R"(<svg xmlns="http://www.w3.org/2000/svg" xmlns:xlink="http://www.w3.org/1999/xlink" width="8" height="8">)" +
               std::string(contents) + "</svg>";
    }
    static Result<IconImage> draw(std::string_view text, unsigned pixels = 16) {
        return renderSvg(bytesOf(text), pixels);
    }
};

TEST_F(SvgRendererTest, drawsToFit) {
    const auto image = draw(svg(R"(<rect width="4" height="8" fill="red"/>)"), 64);
    ASSERT_TRUE(image.ok()) << image.error().description();
    EXPECT_EQ(image->width, 64U);
    EXPECT_EQ(pixelOf(*image, 5, 60), kRed);
    EXPECT_EQ(pixelOf(*image, 60, 60), kNothing);
}

TEST_F(SvgRendererTest, coloursAreNotMultipliedWithTheOpacity) {
    const auto image = draw(svg(R"(<rect width="8" height="8" fill="#ff8000" fill-opacity="0.5"/>)"));
    ASSERT_TRUE(image.ok());
    EXPECT_NEAR(pixelOf(*image, 8, 8)[0], 255, 2);
    EXPECT_NEAR(pixelOf(*image, 8, 8)[1], 128, 2);
    EXPECT_NEAR(pixelOf(*image, 8, 8)[3], 128, 2);
}

TEST_F(SvgRendererTest, refusesWhatIsNoDrawing) {
    for (const char* text : {"", "x", "<html/>", "<svg", "\x89PNG"}) {
        EXPECT_TRUE(draw(text).error().isPosix(EINVAL)) << text;
    }
}

// Whatever such a drawing names is not there for the process that draws.
TEST_F(SvgRendererTest, reachesNoFile) {
    const std::string link =
        R"(<image xlink:href="file:///usr/share/icons/hicolor/index.theme" width="8" height="8"/>)";
    const std::string entity = R"(<!DOCTYPE svg [<!ENTITY x SYSTEM "file:///etc/passwd">]>)" + svg("<text>&x;</text>");
    for (const std::string& text : {svg(link), entity}) {
        const auto image = draw(text);
        if (image.ok()) {
            EXPECT_EQ(pixelOf(*image, 8, 8), kNothing) << text;
        }
    }
}

TEST_F(SvgRendererTest, endsWhatTakesTooMuch) {
    // Each level is ten times the one before.
    std::string bomb = R"(<!DOCTYPE svg [<!ENTITY a "aaaaaaaaaa">)";
    for (char c = 'b'; c <= 'j'; ++c) {
        bomb += std::string("<!ENTITY ") + c + " \"";
        for (int i = 0; i < 10; ++i) bomb += std::string("&") + static_cast<char>(c - 1) + ";";
        bomb += "\">";
    }
    EXPECT_FALSE(draw(bomb + "]>" + svg("<text>&j;</text>")).ok());

    std::string uses = R"(<g id="a"><rect width="8" height="8"/></g>)";
    for (char c = 'b'; c <= 'l'; ++c) {
        uses += std::string(R"(<g id=")") + c + "\">";
        for (int i = 0; i < 10; ++i) uses += std::string(R"(<use xlink:href="#)") + static_cast<char>(c - 1) + "\"/>";
        uses += "</g>";
    }
    EXPECT_FALSE(draw(svg(uses)).ok());

    rusage usage{};
    ASSERT_EQ(::getrusage(RUSAGE_CHILDREN, &usage), 0);
    EXPECT_LT(usage.ru_maxrss, 256 * 1024) << "kilobytes of the largest of all processes that drew";
}

TEST_F(SvgRendererTest, refusesADrawingThatIsTooLarge) {
    EXPECT_FALSE(draw(svg("<!--" + std::string(5U << 20, 'x') + "-->")).ok());
}

TEST_F(SvgRendererTest, saysWhenItsProgramIsMissing) {
    setSvgRendererProgram("/nowhere/renderer");
    EXPECT_TRUE(draw(svg("")).error().isPosix(ENOENT));
    setSvgRendererProgram("/bin/false");
    EXPECT_TRUE(draw(svg("")).error().isPosix(EINVAL));
    setSvgRendererProgram("/bin/cat");
    EXPECT_TRUE(draw(svg("")).error().isPosix(EINVAL));
}

// The icon service

TEST_F(SvgRendererTest, iconsOfBothKindsAreAsLargeAsAskedFor) {
    const auto drawing = iconImageFromData(bytesOf(svg(R"(<rect width="8" height="8" fill="red"/>)")), 48);
    ASSERT_TRUE(drawing.ok());
    EXPECT_EQ(drawing->width, 48U);
    const auto picture = iconImageFromData(pngOf(filled(128, 128, kRed)), 48);
    ASSERT_TRUE(picture.ok());
    EXPECT_EQ(picture->width, 48U);
    for (const unsigned pixels : {0U, kIconSideMax + 1})
        EXPECT_TRUE(iconImageFromData(bytesOf("x"), pixels).error().isPosix(EINVAL));
}

}  // namespace
}  // namespace cindral
