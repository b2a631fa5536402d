#pragma once

#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/foundation/KsURL.h"
#include "platform/foundation/Mutex.h"
#include "platform/foundation/PropertyList.h"
#include "platform/foundation/Result.h"
#include "platform/roster/ApplicationIcon.h"

namespace cindral {

struct RosterSources;
struct RosterContents;
class RosterWatcher;

/// Keys of an application's info dictionary; each value is a bool.
inline constexpr const char* kSupportsDocumentBrowserKey = "UISupportsDocumentBrowser";
inline constexpr const char* kSupportsOpenInPlaceKey = "SupportsOpenInPlace";
inline constexpr const char* kFileSharingEnabledKey = "FileSharingEnabled";

/// The record of one installed application, or of the provider itself.
///
/// Thread safety: immutable.
class RoBundleProxy {
public:
    struct Values {
        std::string bundleIdentifier;
        std::optional<KsURL> dataContainerURL;
        std::string localizedName;
        std::optional<PropertyList::Dictionary> infoDictionary = {};  ///< none when it can't be read
        std::shared_ptr<const ApplicationIcon> icon = {};             ///< null for none
    };
    explicit RoBundleProxy(Values values) : values_(std::move(values)) {}
    virtual ~RoBundleProxy() = default;

    const std::string& bundleIdentifier() const { return values_.bundleIdentifier; }
    /// "#" and the bundle identifier.
    std::string appLibraryIdentifier() const { return "#" + values_.bundleIdentifier; }
    const std::optional<KsURL>& dataContainerURL() const { return values_.dataContainerURL; }
    /// The application's full display name for the preferred localisations of the process.
    const std::string& localizedName() const { return values_.localizedName; }
    std::string description() const;

    /// The record as a keyed archive holds it: its identifier, data container and name.
    PropertyList archived() const;
    /// None for anything but what archived() made.
    static std::shared_ptr<const RoBundleProxy> unarchived(const PropertyList& object);
    /// Whether the value is an object of an archived class, and of which.
    static const std::string* archivedClassOf(const PropertyList& value);
    static constexpr std::string_view kArchivedClass = "RoBundleProxy";

    /// The record of the installed application with that identifier, or null.
    static std::shared_ptr<const RoBundleProxy> bundleProxyForIdentifier(const std::string& bundleIdentifier);
    /// The record of the installed application whose data container, or the Documents folder in it, is at the URL; or
    /// null.
    static std::shared_ptr<const RoBundleProxy> proxyAt(const KsURL& url);
    /// The record whose data container is at the URL or above it, by whole components, the innermost of several, the
    /// provider's own among them; or null. Null for a path with a ".." in it below the container: what that names is not
    /// for text to say. Cheap: asked for the folder of each listed item.
    static std::shared_ptr<const RoBundleProxy> proxyWithContaining(const KsURL& url);

protected:
    const Values values_;
};

/// An installed application.
///
/// Thread safety: immutable.
class RoApplicationProxy : public RoBundleProxy {
public:
    using RoBundleProxy::RoBundleProxy;

    /// The record of the installed application with that identifier, or null.
    static std::shared_ptr<const RoApplicationProxy> applicationProxyForIdentifier(const std::string& bundleIdentifier);

    /// The values of those of the keys that the application has; none when its info dictionary can't be read.
    std::optional<PropertyList::Dictionary> objectsForInfoDictionaryKeys(const std::set<std::string>& keys) const;
    /// Whether the application's documents are published: it has a data container, and says that it supports the document
    /// browser, or both open-in-place and file sharing.
    enum class Publication { published, hasNoDataContainer, cannotBeRead, isNotAskedFor };
    Publication publication() const;
    bool supportsOpenInPlace() const { return isSet(kSupportsOpenInPlaceKey); }
    bool fileSharingEnabled() const { return isSet(kFileSharingEnabledKey); }

    /// The icon for a size of screen: variants 0 and 1 are 48 pixels wide, 15 and 24 96, and 32 192. The smallest that
    /// is as large or larger; none when there is none. Reads files.
    std::optional<IconData> iconDataForVariant(int variant) const;

private:
    bool isSet(const char* key) const;
};

/// Where and how an application is installed.
struct InstalledApplication {
    std::shared_ptr<const RoApplicationProxy> record;
    unsigned type = 0;                ///< 0: by a person for themselves; 2: for everybody, or otherwise
    std::string source = {};          ///< for people: who or what installed it
    std::string container = {};       ///< its data container, also where the record has none; empty when nothing says
    std::string whyNoContainer = {};  ///< for people; empty where the record has a data container
    std::optional<bool> choice = {};  ///< what the person said: publish its documents, or don't
};

/// The registry of installed applications.
///
/// Answers from its last look at the sources. While it is started, it looks again as soon as something about them has
/// changed: an application came, went, or has another name, container or key. Then the notifications of the registry
/// are posted, on the registry's own thread, each at most once for a look.
///
/// Who follows the notifications has the list of before until it enumerates again. So lookups by place go on to answer
/// with the record of an application that went, until the applications of its type are enumerated: what is in a list is
/// the same for all who look at it. Lookups by identifier answer from the last look alone.
///
/// Before it is started it knows the provider's own record alone.
///
/// Thread safety: all operations, from any thread; start() and stop() by one at a time.
class RoApplicationWorkspace {
public:
    static RoApplicationWorkspace& defaultWorkspace();

    /// Looks at the sources, then follows them. After an error line, where they can't be watched, looks every two seconds.
    void start(RosterSources sources);
    /// Returns when no look and no notification is under way. Nothing is installed afterwards.
    void stop();

    /// The record for the provider itself, whose data container holds the storage; null when there is none.
    /// Set by the host, before a provider is made.
    void setOwnRecord(std::shared_ptr<const RoBundleProxy> record);
    std::shared_ptr<const RoBundleProxy> ownRecord() const;

    using Block = std::function<void(const std::shared_ptr<const RoBundleProxy>&)>;
    /// Calls the block for each installed application of the type (0 user-installed, 2 system-wide and other), in a
    /// stable order.
    void enumerateApplicationsOfType(unsigned type, const Block& block);
    /// All of them, type 0 first, in the same order.
    std::vector<InstalledApplication> applications() const;

    /// What the lookups of RoBundleProxy and RoApplicationProxy answer.
    std::shared_ptr<const RoApplicationProxy> applicationFor(const std::string& bundleIdentifier) const;
    std::shared_ptr<const RoApplicationProxy> applicationAt(const KsURL& url) const;
    std::shared_ptr<const RoBundleProxy> recordContaining(const KsURL& url) const;

private:
    RoApplicationWorkspace();
    struct Contents;
    struct FormerRecord {
        std::shared_ptr<const RoApplicationProxy> record;
        unsigned type = 0;
    };
    using FormerRecords = std::map<std::string, FormerRecord, std::less<>>;  ///< by container
    struct ByContainer;

    std::shared_ptr<const Contents> contents() const;
    void setContents(RosterContents contents);
    void forgetFormer(unsigned type);
    ByContainer byContainer() const;

    mutable Mutex mutex_;
    std::shared_ptr<const Contents> contents_ GUARDED_BY(mutex_);
    std::shared_ptr<const FormerRecords> former_ GUARDED_BY(mutex_);
    std::shared_ptr<const RoBundleProxy> ownRecord_ GUARDED_BY(mutex_);
    std::shared_ptr<RosterWatcher> watcher_ GUARDED_BY(mutex_);
};

}  // namespace cindral
