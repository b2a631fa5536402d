#include "provider/LocalThumbnails.h"

#include "provider/AppLibraryFixture.h"
#include "provider/LocalTesselKit.h"

namespace cindral::test {
namespace {

using Sizes = std::vector<unsigned>;

class LocalThumbnailsTest : public AppLibraryTest {
protected:
    /// Installs an application with an icon of each size; answers its record.
    std::shared_ptr<const RoApplicationProxy> installWithIcons(const std::string& identifier, const Sizes& sizes) {
        for (const unsigned size : sizes) {
            const std::string text = std::to_string(size);
            apps_.file("icons/hicolor/" + text + "x" + text + "/apps/" + identifier + ".png", pngOf(size));
        }
        install(identifier, "X-Cindral-SupportsDocumentBrowser=true\nIcon=" + identifier + "\n");
        return RoApplicationProxy::applicationProxyForIdentifier(identifier);
    }
    static std::string pngOf(unsigned side) {
        Bytes data;
        const auto destination = ImageDestination::create(data, kPngTypeIdentifier, 1);
        destination->addImage(IconImage{side, side, std::vector<std::uint8_t>(std::size_t{side} * side * 4, 255)});
        EXPECT_TRUE(destination->finalize());
        return {reinterpret_cast<const char*>(data.data()), data.size()};
    }
    /// How large the icon is to be; 0 for none.
    static unsigned chosen(const RoApplicationProxy& application, bool isTablet, double scale) {
        const auto icon = bestIconData(application, isTablet, scale);
        return icon ? icon->pixels : 0;
    }
    void expectNone(const std::string& identifier, LogLevel level, const std::string& line,
                    const ThumbnailTools& tools = {}) {
        const std::size_t before = log_.count(line);
        EXPECT_EQ(thumbnailForItemIdentifier(identifier, tools), std::nullopt);
        EXPECT_EQ(log_.count(line), before + 1) << line;
        EXPECT_TRUE(log_.containsPart(level, line)) << line;
    }
};

TEST_F(LocalThumbnailsTest, theScaleChoosesTheVariant) {
    const auto all = installWithIcons("a", {48, 96, 192});
    for (const bool isTablet : {false, true}) {
        EXPECT_EQ(chosen(*all, isTablet, 3.0), 192U);
        EXPECT_EQ(chosen(*all, isTablet, 2.0), 96U);
        EXPECT_EQ(chosen(*all, isTablet, 1.0), 48U);
        EXPECT_EQ(chosen(*all, isTablet, 2.5), 48U) << "neither of the two that have a size of their own";
        EXPECT_EQ(chosen(*all, isTablet, 0.9), 0U);
        EXPECT_EQ(chosen(*all, isTablet, 0.0), 0U);
    }
}

TEST_F(LocalThumbnailsTest, aCoarserVariantDoesWhereThereIsNoFiner) {
    const auto middle = installWithIcons("middle", {96});
    EXPECT_EQ(chosen(*middle, false, 3.0), 96U);
    EXPECT_EQ(chosen(*middle, false, 1.0), 48U);
    const auto small = installWithIcons("small", {48});
    EXPECT_EQ(chosen(*small, false, 3.0), 48U);
    EXPECT_EQ(chosen(*small, true, 2.0), 48U);
    const auto tiny = installWithIcons("tiny", {16});
    EXPECT_EQ(chosen(*tiny, false, 3.0), 0U);
}

TEST_F(LocalThumbnailsTest, aPlainFileHasNoneAndNoLine) {
    const std::size_t before = log_.lines().size();
    EXPECT_EQ(thumbnailForItemIdentifier("did=1"), std::nullopt);
    EXPECT_EQ(thumbnailForItemIdentifier(""), std::nullopt);
    EXPECT_EQ(log_.lines().size(), before);
}

TEST_F(LocalThumbnailsTest, everyProblemIsALineAndNoThumbnail) {
    installWithIcons("a", {96});
    EXPECT_TRUE(thumbnailForItemIdentifier("#a"));
    installWithIcons("none", {});
    expectNone("#none", LogLevel::debug, "#none: can't get primary icon data; ");
    ThumbnailTools tools;
    tools.image = [](const IconData&) -> Result<IconImage> { return KsError::posix(EINVAL); };
    expectNone("#a", LogLevel::debug, "#a: can't create icon from cached bitmap", tools);
    tools = {};
    tools.newData = [] { return nullptr; };
    expectNone("#a", LogLevel::error, "#a: can't create new data", tools);
    tools = {};
    tools.newDestination = [](Bytes&) { return nullptr; };
    expectNone("#a", LogLevel::error, "#a: can't create image from new data", tools);
    tools = {};
    tools.image = [](const IconData&) -> Result<IconImage> { return IconImage{}; };
    expectNone("#a", LogLevel::error, "#a: can't finalize image", tools);
    uninstall("a");
    expectNone("#a", LogLevel::debug, "#a: can't get app proxy for a");
}

TEST_F(LocalThumbnailsTest, aBatchIsAnsweredInOrderThenCompleted) {
    installWithIcons("a", {96});
    const auto provider = LocalTesselKit::init();
    std::vector<std::string> calls;
    provider->fetchThumbnailsForItemIdentifiersWithType(
        {"did=1", "#a", "#gone"}, 64,
        [&](const TesselItemIdentifier& identifier, const std::optional<Bytes>& data,
            const std::optional<std::string>& type) {
            EXPECT_EQ(data.has_value(), type.has_value());
            calls.push_back(identifier + " " + type.value_or("none"));
        },
        [&](const std::optional<KsError>& error) {
            EXPECT_FALSE(error);
            calls.emplace_back("done");
        });
    EXPECT_EQ(calls, (std::vector<std::string>{"did=1 none", "#a image/png", "#gone none", "done"}));
    EXPECT_TRUE(log_.containsPart(LogLevel::debug, "fetching thumbnails for [did=1, #a, #gone]"));
    calls.clear();
    provider->fetchThumbnailsForItemIdentifiers(
        {"#a"}, 64,
        [&](const TesselItemIdentifier& identifier, const std::optional<Bytes>& data) {
            EXPECT_TRUE(data && isPng(*data));
            calls.push_back(identifier);
        },
        [&](const std::optional<KsError>&) { calls.emplace_back("done"); });
    EXPECT_EQ(calls, (std::vector<std::string>{"#a", "done"}));
}

}  // namespace
}  // namespace cindral::test
