#pragma once

#include <functional>
#include <map>
#include <string>
#include <vector>

#include "platform/foundation/Dispatch.h"
#include "platform/roster/RosterSources.h"
#include "platform/tessel/TesselManager.h"
#include "provider/HistoryFixture.h"
#include "provider/LocalAppLibraryManager.h"

namespace cindral::test {

/// A host that remembers what it was asked for, and answers as the test says.
class RecordingHost : public TesselManager::Host {
public:
    void signalEnumerator(const TesselItemIdentifier& container, TesselManager::Completion completion) override {
        {
            const MutexLock lock(mutex_);
            signalled_.push_back(container);
        }
        completion(std::nullopt);
    }
    void deleteSearchableItems(const std::vector<std::string>& domains, TesselManager::Completion completion) override {
        {
            const MutexLock lock(mutex_);
            deletedDomains_.push_back(domains);
        }
        completion(deletionError);
    }
    std::vector<TesselItemIdentifier> signalled() const {
        const MutexLock lock(mutex_);
        return signalled_;
    }
    std::vector<std::vector<std::string>> deletedDomains() const {
        const MutexLock lock(mutex_);
        return deletedDomains_;
    }

    std::optional<KsError> deletionError;  ///< before anybody asks

private:
    mutable Mutex mutex_;
    std::vector<TesselItemIdentifier> signalled_ GUARDED_BY(mutex_);
    std::vector<std::vector<std::string>> deletedDomains_ GUARDED_BY(mutex_);
};

/// What a change observer is told, in order: "u IDENTIFIER", "d IDENTIFIER"; and which calls there were.
class ChangeCalls : public TesselChangeObserver {
public:
    void didUpdateItems(TesselItems items) override {
        calls.emplace_back("update");
        for (const auto& item : items) log.push_back("u " + item->itemIdentifier());
    }
    void didDeleteItemsWithIdentifiers(std::vector<TesselItemIdentifier> identifiers) override {
        calls.emplace_back("delete");
        for (const auto& identifier : identifiers) log.push_back("d " + identifier);
    }
    void finishEnumeratingChangesUpToSyncAnchor(TesselSyncAnchor newAnchor, bool /*moreComing*/) override {
        anchor = std::move(newAnchor);
        finished.signal();
    }
    void finishEnumeratingWithError(const KsError& why) override {
        error = why;
        finished.signal();
    }

    std::vector<std::string> calls;
    std::vector<std::string> log;
    std::optional<TesselSyncAnchor> anchor;
    std::optional<KsError> error;
    DispatchSemaphore finished{0};
};

/// A provider's platform with a registry of applications: desktop entries in a folder, each with a data container.
class AppLibraryTest : public HistoryTest {
protected:
    AppLibraryTest();
    ~AppLibraryTest() override;

    /// Installs an application that qualifies, with a Documents folder; looks at the registry.
    void install(const std::string& identifier, const std::string& keys = "X-Cindral-SupportsDocumentBrowser=true\n");
    void uninstall(const std::string& identifier);
    /// Has the registry look, in an order of its own.
    void look();
    std::string documents(const std::string& identifier) const { return container(identifier) + "/Documents"; }
    std::string container(const std::string& identifier) const { return apps_ / ("data/" + identifier); }
    static std::shared_ptr<LocalAppLibraryManager> manager(LocalAppLibraryCacheSource source) {
        return LocalAppLibraryManager::create(source);
    }
    static std::shared_ptr<LocalAppLibraryCache> cache(LocalAppLibraryCacheSource source) {
        return LocalAppLibraryCache::shared(source);
    }
    /// What a cache says, as a new process would read it.
    LocalAppLibraryCache::Loaded cached(LocalAppLibraryCacheSource source) const;
    /// Writes a cache with the applications that are installed and qualify, at a version.
    void save(LocalAppLibraryCacheSource source, std::uint64_t version);
    static std::vector<std::string> identifiers(const TesselItems& items);

    std::shared_ptr<RecordingHost> host_ = std::make_shared<RecordingHost>();
    TemporaryFolder apps_;
};

inline constexpr auto kMain = LocalAppLibraryCacheSource::main;
inline constexpr auto kWorkingSet = LocalAppLibraryCacheSource::workingSet;

}  // namespace cindral::test
