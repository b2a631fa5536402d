#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "host/Commands.h"
#include "host/EditOptions.h"
#include "host/TextOutput.h"
#include "platform/tessel/FreeName.h"

namespace cindral {

/// What is said to the person who waits for an edit, and asked.
struct EditTerminal {
    /// The answer to a question; yes where nobody can be asked.
    std::function<bool(const std::string& question)> confirms;
    /// A whole line that says what went wrong.
    std::function<void(const std::string& line)> complain;
    /// How far it is: replaces what was shown before; empty takes it away. Null where nobody looks.
    std::function<void(const std::string& text)> show;

    /// Standard error, where it is a terminal.
    static EditTerminal ofProcess();
};

/// The commands that change something: each asks the provider for the edit of every item named.
///
/// What fails is said in a line of its own, the others go on, and the command has failed. The storage itself takes no
/// new files from outside: they are built in its temporary folder, and moved.
///
/// Errors are the host's own, with a line for people.
///
/// Thread safety: for one thread at a time.
class EditCommands {
public:
    /// All borrowed for life.
    EditCommands(const Commands::Context& context, EditTerminal terminal, TextOutput& output);

    Result<void> run();

private:
    using ItemResult = Result<std::shared_ptr<const TesselItem>>;
    using Start = std::function<std::shared_ptr<TesselProgress>(TesselExtension::ItemCompletion)>;

    /// Calls back for each word from `first` up to the last but `leftOver`.
    Result<void> forEach(const std::function<Result<void>(const std::string&)>& edit, std::size_t first = 0,
                         std::size_t leftOver = 0);

    Result<void> importFile(const std::string& file, const TesselItemIdentifier& folder);
    Result<void> makeFolder(const std::string& word);
    Result<void> rename(const std::string& word, const std::string& name);
    Result<void> move(const std::string& word, const TesselItemIdentifier& folder);
    Result<void> remove(const std::string& word);
    Result<void> trash(const std::string& word);
    Result<void> restore(const std::string& word);
    Result<void> emptyTrash();
    Result<void> changeTag(const std::string& word, const std::string& tag, bool isPutOn);
    Result<void> printTags(const std::string& word);
    Result<void> setRank(const std::string& word, std::optional<std::int64_t> rank);
    Result<void> touchUsed(const std::string& word);

    bool confirmsDeletion();
    Result<TesselItemIdentifier> identify(const std::string& word) const;
    Result<TesselItemIdentifier> target() const;
    Result<std::shared_ptr<const TesselItem>> item(const std::string& word) const;
    /// Tries the name and, where both are to be kept, others until one is free.
    ItemResult withFreeName(const std::string& name, NameKind kind,
                            const std::function<ItemResult(const std::string& name)>& attempt) const;
    ItemResult reparent(const TesselItem& item, const TesselItemIdentifier& folder, const std::string& subject);

    ItemResult await(const std::string& subject, const Start& start) const;
    std::optional<KsError> awaitEnd(
        const std::string& subject,
        const std::function<std::shared_ptr<TesselProgress>(TesselExtension::Completion)>& start) const;
    void follow(const std::shared_ptr<TesselProgress>& progress, const std::string& subject) const;

    Result<void> print(const std::string& subject, const ItemResult& result);
    KsError failure(const std::string& subject, const KsError& error) const;

    TesselExtension& provider() const { return context_.client.provider(); }

    const Commands::Context& context_;
    const EditOptions& options_;
    const EditTerminal terminal_;
    TextOutput& output_;
};

}  // namespace cindral
