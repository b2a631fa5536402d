#pragma once

#include <memory>
#include <string>
#include <string_view>

namespace cindral {

/// The order in which people expect names: that of their language, numbers by their value.
///
/// Thread safety: immutable.
class NameCollation {
public:
    /// A locale as the environment names it ("de_DE.UTF-8"); "C", "POSIX" and what is not known have the order that
    /// languages have in common.
    explicit NameCollation(const std::string& locale);
    ~NameCollation();
    NameCollation(const NameCollation&) = delete;
    NameCollation& operator=(const NameCollation&) = delete;

    /// LC_ALL, LC_COLLATE or LANG, the first that says something.
    static std::string localeOfProcess();

    /// Bytes whose order is the order of the names they are made from.
    std::string key(std::string_view name) const;
    /// What has to be the same for keys made at different times to be comparable.
    const std::string& version() const { return version_; }

private:
    struct Implementation;
    std::unique_ptr<Implementation> implementation_;
    std::string version_;
};

}  // namespace cindral
