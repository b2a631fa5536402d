#include "provider/AppLibraryFixture.h"

#include <fmt/format.h>

#include <filesystem>

namespace cindral::test {

AppLibraryTest::AppLibraryTest() {
    TesselManager::defaultManager().setHost(host_);
    apps_.folder("entries");
    look();
}

AppLibraryTest::~AppLibraryTest() {
    RoApplicationWorkspace::defaultWorkspace().stop();
    TesselManager::defaultManager().setHost(nullptr);
}

void AppLibraryTest::look() {
    RosterSources sources;
    sources.entryFolders = {apps_ / "entries"};
    sources.storage = storage_.path();
    // A start takes a look before it returns, so that no test waits for the registry's thread.
    RoApplicationWorkspace::defaultWorkspace().start(sources);
}

void AppLibraryTest::install(const std::string& identifier, const std::string& keys) {
    apps_.folder("data/" + identifier + "/Documents");
    apps_.file("entries/" + identifier + ".desktop",
               fmt::format("[Desktop Entry]\nType=Application\nName=The {}\nX-Cindral-DataContainer={}\n{}", identifier,
                           container(identifier), keys));
    look();
}

void AppLibraryTest::uninstall(const std::string& identifier) {
    std::filesystem::remove(apps_ / ("entries/" + identifier + ".desktop"));
    look();
}

LocalAppLibraryCache::Loaded AppLibraryTest::cached(LocalAppLibraryCacheSource source) const {
    LocalAppLibraryCache cache(source, TesselManager::defaultManager().applicationSupportURL());
    LocalAppLibraryCache::Loaded loaded;
    cache.queue().sync([&] { loaded = cache.loadBundleProxies(); });
    return loaded;
}

void AppLibraryTest::save(LocalAppLibraryCacheSource source, std::uint64_t version) {
    RoBundleProxies list;
    for (const unsigned type : {0U, 2U}) {
        RoApplicationWorkspace::defaultWorkspace().enumerateApplicationsOfType(
            type, [&](const auto& record) { LocalAppLibraryManager::addIfQualified(record, list); });
    }
    const auto shared = cache(source);
    shared->queue().sync(
        [&] { ASSERT_TRUE(shared->saveBundleProxies(list, version, /*incrementVersion=*/false).ok()); });
}

std::vector<std::string> AppLibraryTest::identifiers(const TesselItems& items) {
    std::vector<std::string> identifiers;
    for (const auto& item : items) identifiers.push_back(item->itemIdentifier());
    return identifiers;
}

}  // namespace cindral::test
