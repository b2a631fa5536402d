#include "host/HostProcess.h"

#include <fmt/format.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "host/HealthCheck.h"
#include "host/HostError.h"
#include "host/HostVersion.h"
#include "host/JsonText.h"
#include "host/StorageFolders.h"
#include "host/TerminalText.h"
#include "platform/foundation/Log.h"
#include "platform/foundation/RootDirectories.h"
#include "platform/foundation/SerialQueue.h"
#include "platform/revisions/RvStorageManager.h"
#include "platform/roster/Roster.h"
#include "platform/tessel/TesselManager.h"

namespace cindral {
namespace {

constexpr const char* kOwnBundleIdentifier = "com.vemra.CindralStorage";

std::string storeFolder(const std::string& state) {
    return state + "/store";
}

std::string applicationSupportFolder(const std::string& state) {
    return state + "/Application Support";
}

Result<std::shared_ptr<VolumeStore>> openStore(const std::string& state) {
    auto store = VolumeStore::open(storeFolder(state));
    if (store.ok()) return std::shared_ptr<VolumeStore>(*std::move(store));
    const auto holder = store.error().userInfo().find("holder");
    if (store.error().isPosix(EBUSY) && holder != store.error().userInfo().end()) {
        return hostFailure(
                   fmt::format("the state folder {} is in use by process {}", terminalText(state), holder->second))
            .with("holder", holder->second);
    }
    return hostFailure(fmt::format("can't open the state folder {}: {}", terminalText(state), store.error().reason()));
}

/// The record of the provider itself: its data container is what holds the storage.
std::shared_ptr<const RoBundleProxy> ownRecord(const PresentedPaths& paths) {
    const KsURL storage = KsURL::fileURL(paths.presented());
    return std::make_shared<const RoBundleProxy>(
        RoBundleProxy::Values{kOwnBundleIdentifier, storage.deletingLastPathComponent().value_or(storage), "Cindral"});
}

void appendField(std::string& out, std::string_view key, std::string_view value) {
    out += out.empty() ? '{' : ',';
    appendJsonString(out, key);
    out += ':';
    out += value;
}

template <typename Texts>
std::string listText(const Texts& texts) {
    std::string out = "[";
    for (const auto& text : texts) {
        if (out.size() > 1) out += ',';
        appendJsonString(out, text);
    }
    return out + "]";
}

std::vector<std::string> rootURLs(const PresentedPaths& paths) {
    std::vector<std::string> urls;
    for (const auto& root : RootDirectories::shared().all()) urls.push_back(paths.realURL(KsURL::fileURL(root->path)));
    return urls;
}

Recorder::Choice recorderChoice(RecorderChoice choice) {
    switch (choice) {
        case RecorderChoice::automatic: return Recorder::Choice::automatic;
        case RecorderChoice::inotify: return Recorder::Choice::inotify;
        case RecorderChoice::fanotify: return Recorder::Choice::fanotify;
    }
    return Recorder::Choice::automatic;
}

/// Whether the command asks for changes. The others look at the files and go.
bool records(HostCommand command) {
    switch (command) {
        case HostCommand::anchor:
        case HostCommand::changes:
        case HostCommand::watch:
        case HostCommand::status:
        case HostCommand::doctor:
        case HostCommand::find:
        case HostCommand::recents:
        case HostCommand::tagged:
        case HostCommand::favorites:
        case HostCommand::trashed:
        case HostCommand::allTags:
        case HostCommand::rpc:
        case HostCommand::serve: return true;
        case HostCommand::ls:
        case HostCommand::tree:
        case HostCommand::info:
        case HostCommand::url:
        case HostCommand::id:
        case HostCommand::edit:
        case HostCommand::thumbnail:
        case HostCommand::apps:
        case HostCommand::link:
        case HostCommand::appsEnable:
        case HostCommand::appsDisable: return false;
    }
    return false;
}

std::string searchStatusText(const SearchIndex::Status& search) {
    std::string out;
    appendField(out, "exists", search.exists ? "true" : "false");
    appendField(out, "isGathering", search.isGathering ? "true" : "false");
    appendField(out, "items", fmt::to_string(search.items));
    appendField(out, "bytes", fmt::to_string(search.bytes));
    if (search.eventsBehind) appendField(out, "eventsBehind", fmt::to_string(*search.eventsBehind));
    return out + "}";
}

KsDate dateOf(std::chrono::system_clock::time_point time) {
    const auto since = time.time_since_epoch();
    const auto seconds = std::chrono::floor<std::chrono::seconds>(since);
    return {seconds.count(),
            static_cast<std::uint32_t>(std::chrono::duration_cast<std::chrono::nanoseconds>(since - seconds).count())};
}

std::string_view recorderStateName(const Recorder::Status& recorder) {
    if (recorder.failure) return "failing";
    return recorder.isReading ? "reading" : "following";
}

std::string problemsText(const std::vector<HealthProblem>& problems) {
    std::string out = "[";
    for (const auto& [what, remedy] : problems) {
        if (out.size() > 1) out += ',';
        out += fmt::format(R"({{"what":{},"remedy":{}}})", jsonString(what), jsonString(remedy));
    }
    return out + "]";
}

/// What is checked by comparison instead of by events, and what below the roots is not published at all: "full" where
/// there is neither.
std::string coverageText(const Recorder::Status& recorder, const PresentedPaths& paths) {
    std::string out = "[";
    const auto append = [&](std::string_view path, std::string_view how, std::string_view why) {
        if (out.size() > 1) out += ',';
        out += R"({"url":)";
        appendJsonString(out, paths.realURL(KsURL::fileURL(std::string(path))));
        out += fmt::format(R"(,"how":"{}","why":)", how);
        appendJsonString(out, why);
        out += '}';
    };
    for (const auto& [path, why] : recorder.uncovered) append(path, "comparison", why);
    for (const auto& [path, why] : RootDirectories::shared().leftOut()) append(path, "left out", why);
    return out.size() == 1 ? jsonString("full") : out + "]";
}

}  // namespace

HostProcess::HostProcess(HostOptions options, PresentedPaths paths, std::string state,
                         std::shared_ptr<VolumeStore> store, std::unique_ptr<ErrorLog> errors)
    : options_(std::move(options)),
      paths_(std::move(paths)),
      state_(std::move(state)),
      errors_(std::move(errors)),
      store_(std::move(store)) {}

Result<std::vector<std::string>> HostProcess::setAsideWhatStops(const std::string& state,
                                                                ProviderRepair repairProvider) {
    std::vector<std::string> aside = TRY(VolumeStore::setAsideWhatStops(storeFolder(state)));
    const std::vector<std::string> providers = TRY(repairProvider(applicationSupportFolder(state)));
    aside.insert(aside.end(), providers.begin(), providers.end());
    return aside;
}

Result<std::unique_ptr<HostProcess>> HostProcess::start(HostOptions options, const HostEnvironment& environment,
                                                        TesselExtensionFactory makeProvider, const Steps& steps) {
    if (options.storage.empty())
        return hostFailure("there is no home folder: say where the documents are with --storage");
    if (options.state.empty()) return hostFailure("there is no home folder: say where to keep the state with --state");
    TRY(storage_folders::checkApart(options.storage, options.state));

    std::string state = TRY(storage_folders::makeState(options.state));
    if (steps.stateIsThere) TRY(steps.stateIsThere(state));
    auto errors = std::make_unique<ErrorLog>();
    auto store = TRY(openStore(state));
    if (steps.stateIsOurs) TRY(steps.stateIsOurs(state));
    const std::string real = TRY(storage_folders::makeStorage(options.storage));
    auto paths = TRY(storage_folders::present(options.storage, real, state, environment));
    if (!paths.isSame()) logInfo("the storage {} is presented to the provider as {}", paths.real(), paths.presented());

    // The constructor is nobody else's to call.
    std::unique_ptr<HostProcess> host(
        new HostProcess(std::move(options), std::move(paths), std::move(state), std::move(store), std::move(errors)));
    TRY(host->connect());
    RoApplicationWorkspace::defaultWorkspace().start(rosterSources(host->options_, environment));
    host->provider_ = makeProvider();
    host->search_ =
        std::make_shared<SearchIndex>(host->provider_, *host->signals_, host->state_ + "/search-index",
                                      NameCollation::localeOfProcess(), [store = host->store_] {
                                          return SearchIndex::Moment{store->uuid().string(), store->currentEventID()};
                                      });
    host->signals_->setSearchableItems(host->search_);
    host->provider_->waitUntilReady();
    if (records(host->options_.command)) host->startRecorder();
    // Who asks the daemon finds the answer there.
    if (host->options_.command == HostCommand::serve) host->search_->follow();
    return host;
}

Result<void> HostProcess::connect() {
    RvStorageManager::defaultManager().setStore(store_);
    if (auto root = RootDirectories::shared().add(paths_.presented(), RootPolicy::storage); !root.ok()) {
        return hostFailure(
            fmt::format("can't open the storage {}: {}", terminalText(paths_.real()), root.error().reason()));
    }
    RoApplicationWorkspace::defaultWorkspace().setOwnRecord(ownRecord(paths_));
    TesselManager::defaultManager().setDocumentStorageURL(KsURL::fileURL(paths_.presented()));
    TesselManager::defaultManager().setApplicationSupportURL(KsURL::fileURL(applicationSupportFolder(state_)));
    TesselManager::defaultManager().setSharesDesktopTags(options_.desktopTags);
    TesselManager::defaultManager().setHost(signals_);
    return {};
}

/// Once the provider has said which folders of applications it publishes: what was below one that seems to be no root any
/// more would be forgotten, and come back under other numbers.
void HostProcess::startRecorder() {
    const auto storageFirst = [storage = paths_.presented()](Recorder::Roots roots) {
        std::ranges::stable_partition(roots, [&](const auto& root) { return root->path == storage; });
        return roots;
    };
    Recorder::Options recorderOptions;
    recorderOptions.choice = recorderChoice(options_.recorder);
    recorder_ = Recorder::start(store_, storageFirst(RootDirectories::shared().all()), std::move(recorderOptions));
    EventHistory::setShared(recorder_);
    const auto follow = [recorder = std::weak_ptr(recorder_), storageFirst](const Recorder::Roots& roots) {
        const auto current = recorder.lock();
        // What there was at the start is read first: until then, everything would seem to have just come.
        if (!current || !current->drain().ok()) return;
        if (const Result<void> set = current->setRoots(storageFirst(roots)); !set.ok())
            logError("can't record what happens in the folders of applications; {}", set.error().description());
    };
    // From now on; and once for what may have changed since the recorder was told.
    RootDirectories::shared().setObserver(follow);
    RootDirectories::shared().tellObserver();
    RvStorageManager::defaultManager().setCatchUp([recorder = std::weak_ptr(recorder_)] {
        const auto current = recorder.lock();
        // Nobody waits for the first reading to find one object: the tree itself is searched meanwhile.
        return current && current->isReady() && current->drain().ok();
    });
}

HostProcess::~HostProcess() {
    // Who waits for the history is let go of first.
    if (recorder_) recorder_->stop();
    RoApplicationWorkspace::defaultWorkspace().stop();
    signals_->setSearchableItems(nullptr);
    if (search_) search_->stop();
    search_.reset();
    provider_.reset();
    // A provider that goes leaves its last work to the main queue.
    SerialQueue::main().sync([] {});
    TesselManager::defaultManager().setHost(nullptr);
    RoApplicationWorkspace::defaultWorkspace().setOwnRecord(nullptr);
    RvStorageManager::defaultManager().setCatchUp({});
    RootDirectories::shared().setObserver(nullptr);
    EventHistory::setShared(nullptr);
    recorder_.reset();
    RootDirectories::shared().setApplicationContainers({});
    RootDirectories::shared().remove(paths_.presented());
    RvStorageManager::defaultManager().setStore(nullptr);
    store_.reset();
}

void HostProcess::waitForHistory() const {
    // What went wrong was logged.
    if (recorder_) (void)recorder_->drain();
}

std::string HostProcess::helloText() const {
    const auto urlOf = [](const std::string& path) { return KsURL::fileURL(path).absoluteString(); };
    std::vector<std::string> folders;
    for (const std::string& folder : options_.applications) folders.push_back(urlOf(folder));
    std::string out;
    appendField(out, "version", jsonString(hostVersion()));
    appendField(out, "process", fmt::to_string(::getpid()));
    appendField(out, "storage", jsonString(urlOf(paths_.real())));
    appendField(out, "storageOption", jsonString(urlOf(options_.storage)));
    appendField(out, "recorderOption", jsonString(recorderChoiceName(options_.recorder)));
    appendField(out, "applicationFolders", listText(folders));
    appendField(out, "flatpak", options_.flatpak ? "true" : "false");
    appendField(out, "desktopTags", options_.desktopTags ? "true" : "false");
    return out + "}";
}

void HostProcess::beginStop() const {
    if (recorder_ && !recorder_->isReady()) recorder_->stop();
}

std::string HostProcess::statusText() const {
    const std::vector<std::string> roots = rootURLs(paths_);
    const VolumeStore::Counts counts = store_->counts();
    const std::uint64_t currentEventID = store_->currentEventID();
    const Recorder::Status recorder = recorder_ ? recorder_->status() : Recorder::Status{};

    std::string out;
    appendField(out, "version", jsonString(hostVersion()));
    appendField(out, "storage", jsonString(paths_.real()));
    appendField(out, "state", jsonString(state_));
    appendField(out, "recorder", jsonString(recorder.recorder));
    appendField(out, "recorderState", jsonString(std::string(recorderStateName(recorder))));
    appendField(out, "recorderOption", jsonString(recorderChoiceName(options_.recorder)));
    appendField(out, "applicationFolders", listText(options_.applications));
    appendField(out, "flatpak", options_.flatpak ? "true" : "false");
    appendField(out, "desktopTags", options_.desktopTags ? "true" : "false");
    appendField(out, "roots", listText(roots));
    appendField(out, "objects", fmt::to_string(counts.objects));
    appendField(out, "documents", fmt::to_string(counts.documents));
    appendField(out, "events", fmt::to_string(counts.events));
    appendField(out, "oldestEventID", fmt::to_string(store_->historyBegin().value_or(currentEventID)));
    if (const auto oldest = store_->oldestEventTime())
        appendField(out, "oldestEventDate", jsonString(dateOf(*oldest).rfc3339()));
    appendField(out, "currentEventID", fmt::to_string(currentEventID));
    appendField(out, "volumeUUID", jsonString(store_->uuid().string()));
    appendField(out, "coverage", coverageText(recorder, paths_));
    appendField(out, "auditedDifferences", fmt::to_string(recorder.auditedDifferences));
    appendField(out, "watches",
                fmt::format(R"({{"used":{},"limit":{}}})", recorder.watches.used, recorder.watches.limit));
    appendField(out, "appLibraries", fmt::to_string(roots.empty() ? 0 : roots.size() - 1));
    const SearchIndex::Status search = search_->status();
    appendField(out, "search", searchStatusText(search));
    const ErrorLog::Recent errors = errors_->recent(KsDate::now());
    appendField(out, "errors", fmt::format(R"({{"lastHour":{},"last":{}}})", errors.count, jsonString(errors.last)));
    appendField(out, "problems",
                problemsText(findHealthProblems({paths_, state_, recorder, store_->failure(), search, errors})));
    return out + "}";
}

Result<std::string> HostProcess::doctorText() const {
    if (!recorder_) return hostFailure("nothing is recorded");
    const auto unwell = [](std::string_view what, const KsError& error) {
        return hostFailure(fmt::format("can't compare {}: {}", what, messageOf(error)));
    };
    const auto differences = recorder_->audit();
    if (!differences.ok()) return unwell("the files", differences.error());
    const auto audit = search_->audit();
    if (!audit.ok()) return unwell("the search index", audit.error());
    // Whatever was logged: all has been looked at.
    errors_->forget();
    const SearchIndex::Status search = search_->status();
    std::string out;
    appendField(out, "objects", fmt::to_string(store_->counts().objects));
    appendField(out, "differences", fmt::to_string(*differences));
    appendField(out, "search",
                fmt::format(R"({{"items":{},"wasDamaged":{},"missing":{},"outdated":{},"superfluous":{}}})",
                            search.items, audit->wasDamaged, audit->missing, audit->outdated, audit->superfluous));
    std::vector<std::string> repairs;
    if (!store_->replacement().empty()) repairs.push_back(store_->replacement());
    appendField(out, "repairs", listText(repairs));
    appendField(out, "problems",
                problemsText(findHealthProblems({paths_, state_, recorder_->status(), store_->failure(), search, {}})));
    return out + "}";
}

}  // namespace cindral
