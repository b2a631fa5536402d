#include "platform/roster/ApplicationIcon.h"

#include <sys/stat.h>
#include <unistd.h>

#include "platform/roster/RosterFixture.h"

namespace cindral::test {
namespace {

namespace fs = std::filesystem;

class ApplicationIconTest : public RosterSourcesTest {
protected:
    void put(const std::string& path, const std::string& contents) {
        folder_.file("share/icons/hicolor/" + path, contents);
    }
    std::string found(unsigned pixels, const std::string& icon = "writer") const {
        const auto named =
            ApplicationIcon::named(icon, {folder_ / "none", folder_ / "share/icons"}, {folder_ / "loose"});
        const auto data = named->data(pixels);
        if (!data) return "none";
        EXPECT_EQ(data->pixels, pixels);
        return std::string(textOf(data->bytes));
    }
};

TEST_F(ApplicationIconTest, isTheNearestThatIsLargeEnough) {
    EXPECT_EQ(found(48), "none");
    put("32x32/apps/writer.png", "32");
    EXPECT_EQ(found(48), "none");
    put("256x256/apps/writer.png", "256");
    put("64x64/apps/writer.png", "64");
    EXPECT_EQ(found(48), "64");
    EXPECT_EQ(found(64), "64");
    EXPECT_EQ(found(96), "256");
    EXPECT_EQ(found(257), "none");
    put("48x48/apps/writer.png", "48");
    EXPECT_EQ(found(48), "48");
    put("48x48@2/apps/writer.png", "96");
    EXPECT_EQ(found(96), "96");
}

TEST_F(ApplicationIconTest, aDrawingIsEverySizeAndAPictureOfTheSizeIsBetter) {
    put("256x256/apps/writer.png", "256");
    put("scalable/apps/writer.svg", "svg");
    EXPECT_EQ(found(96), "svg");
    put("96x96/apps/writer.png", "96");
    EXPECT_EQ(found(96), "96");
}

TEST_F(ApplicationIconTest, otherFoldersOfATheme) {
    for (const char* size : {"48x64", "x48", "48", "48x48x", "48x48@", "48x48@0", "0x0", "5000x5000", "symbolic",
                             "99999999999x99999999999"})
        put(std::string(size) + "/apps/writer.png", size);
    put("48x48/mimetypes/writer.png", "mime");
    put("48x48/apps/other.png", "other");
    EXPECT_EQ(found(1), "none");
}

TEST_F(ApplicationIconTest, looseIconsAndFilesAreOfAnySize) {
    folder_.file("loose/writer.svg", "loose");
    EXPECT_EQ(found(192), "loose");
    EXPECT_EQ(found(192, "writer.svg"), "loose");
    EXPECT_EQ(found(192, folder_ / "loose/writer.svg"), "loose");
    put("48x48/apps/writer.png", "48");
    EXPECT_EQ(found(48), "48");
}

TEST_F(ApplicationIconTest, aNameLeadsNowhereElse) {
    folder_.file("secret.png", "secret");
    folder_.file("loose/.hidden.png", "hidden");
    for (const char* icon : {"../secret", "../secret.png", "", ".hidden", "a/b", "..", "."})
        EXPECT_EQ(found(48, icon), "none") << icon;
}

TEST_F(ApplicationIconTest, nothingIsOpenedThatIsNoFile) {
    folder_.folder("loose");
    ASSERT_EQ(::mkfifo((folder_ / "loose/pipe.png").c_str(), 0600), 0);
    EXPECT_EQ(found(48, "pipe"), "none");
    EXPECT_EQ(found(48, "/dev/zero"), "none");
    folder_.file("loose/huge.png", std::string(ApplicationIcon::kBytesMax + 1, 'x'));
    EXPECT_EQ(found(48, "huge"), "none");
}

TEST_F(ApplicationIconTest, aFlatpaksIsInWhatItExports) {
    const auto deployment = FlatpakTree::named("a", "A");
    const std::string active = user_.deploy("a", deployment);
    user_.activate("a", deployment);
    fs::create_directories(active + "/export/share/icons/hicolor/64x64/apps");
    const std::string outside = folder_.file("outside.png", "outside");
    folder_.file("share/icons/hicolor/64x64/apps/a.png", "somebody else's");
    const auto icon = ApplicationIcon::exported("a", user_.path() + "/app", "a/current/active");
    EXPECT_FALSE(icon->data(48));
    fs::create_symlink(outside, active + "/export/share/icons/hicolor/64x64/apps/a.png");
    EXPECT_FALSE(icon->data(48)) << "links lead nowhere else";
    fs::remove(active + "/export/share/icons/hicolor/64x64/apps/a.png");
    std::string written = fs::path(active).lexically_relative(folder_.path()).string();
    folder_.file(written + "/export/share/icons/hicolor/64x64/apps/a.png", "own");
    ASSERT_TRUE(icon->data(48));
    EXPECT_EQ(textOf(icon->data(48)->bytes), "own");
    EXPECT_FALSE(ApplicationIcon::exported("/etc/hostname", user_.path() + "/app", "a/current/active")->data(48));
}

TEST_F(ApplicationIconTest, variantsAreSizesOfScreens) {
    for (const unsigned size : {48U, 96U, 192U})
        put(std::to_string(size) + "x" + std::to_string(size) + "/apps/writer.png", std::to_string(size));
    RoBundleProxy::Values values{"a", std::nullopt, "A"};
    EXPECT_FALSE(RoApplicationProxy(values).iconDataForVariant(0));
    values.icon = ApplicationIcon::named("writer", {folder_ / "share/icons"}, {});
    const RoApplicationProxy application(values);
    const auto variant = [&](int number) { return std::string(textOf(application.iconDataForVariant(number)->bytes)); };
    EXPECT_EQ(variant(0), "48");
    EXPECT_EQ(variant(1), "48");
    EXPECT_EQ(variant(15), "96");
    EXPECT_EQ(variant(24), "96");
    EXPECT_EQ(variant(32), "192");
    EXPECT_FALSE(application.iconDataForVariant(2));
}

}  // namespace
}  // namespace cindral::test
