#pragma once

#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "host/ChangePrinter.h"
#include "host/HostOptions.h"
#include "host/ItemText.h"
#include "host/PresentedPaths.h"
#include "host/ProviderAccess.h"
#include "host/SearchQueries.h"
#include "host/SignalDispatcher.h"
#include "host/TextOutput.h"

namespace cindral {

/// The commands that people type: each asks the provider, and prints.
///
/// Errors are the host's own, with a line for people.
///
/// Thread safety: for one thread at a time.
class Commands {
public:
    struct Context {
        ProviderAccess& client;
        const PresentedPaths& paths;
        const HostOptions& options;
        const HostEnvironment& environment;
        std::function<Result<std::string>()> statusText;  ///< as JSON
        SignalDispatcher& signals;
        /// From the call on, what asks a command that has no end to end makes the descriptor readable.
        std::function<Result<int>()> stopDescriptor;
        SearchQueries& search;
        std::function<Result<std::string>()> doctorText;  ///< as JSON
        /// Where what stopped the start was put before this one.
        std::vector<std::string> setAside;
    };

    /// All borrowed for life.
    Commands(Context context, TextOutput& output);

    /// Does what the options say; `rpc` is not among it.
    Result<void> run();

    /// How an item is named on the command line: an identifier has a well-known name or begins like one; all else is a
    /// path.
    static bool isIdentifier(std::string_view item);
    static Result<TesselItemIdentifier> identifierOf(const Context& context, const std::string& named);
    static Result<TesselItemIdentifier> identifierAt(const Context& context, const std::string& path);
    /// An error where there is no working folder for it to be relative to.
    static Result<std::string> absolutePath(const Context& context, const std::string& path);

private:
    Result<void> list();
    Result<void> tree();
    Result<void> info();
    Result<void> url();
    Result<void> id();
    Result<void> anchor();
    Result<void> changes();
    Result<void> watch();
    Result<void> status();
    Result<void> doctor();
    Result<void> thumbnail();
    Result<void> search(const SearchQuery& query);

    /// The item that was named; the root container where none was.
    Result<TesselItemIdentifier> identifier() const;
    Result<std::shared_ptr<const TesselItem>> item() const;
    /// The named item's text, or the storage's path.
    std::string subject() const;
    KsError failure(const KsError& error) const;
    /// The container that was named; an error where it is none.
    Result<TesselItemIdentifier> container() const;
    Result<TesselSyncAnchor> anchorOf(const TesselItemIdentifier& container) const;
    /// Prints the changes since the anchor, which is moved on, until there are no more or `stop` is readable.
    Result<void> follow(ChangePrinter& printer, const TesselItemIdentifier& container, TesselSyncAnchor& anchor,
                        int stop);
    ChangePrinter changePrinter();

    void printItem(const TesselItem& item);
    void printValue(std::string_view key, const std::string& value);

    const Context context_;
    TextOutput& output_;
    const ItemText text_;
};

}  // namespace cindral
