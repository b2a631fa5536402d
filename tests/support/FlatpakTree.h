#pragma once

#include <string>
#include <string_view>

namespace cindral::test {

/// A Flatpak installation on disk, laid out as Flatpak 1.14 does it: deployments in folders of their own, and links to
/// the current branch and the active deployment, which are replaced by renaming.
class FlatpakTree {
public:
    explicit FlatpakTree(std::string path) : path_(std::move(path)) {}

    const std::string& path() const { return path_; }

    /// What a deployment holds. An empty entry: none is exported.
    struct Deployment {
        std::string metadata;
        std::string entry;
        std::string commit = "0a1b";
        std::string branch = "stable";
    };
    /// Puts the deployment's files in place; nobody sees them yet.
    std::string deploy(const std::string& identifier, const Deployment& deployment) const;
    /// Makes a deployment the active one of the current branch.
    void activate(const std::string& identifier, const Deployment& deployment) const;
    void install(const std::string& identifier, const Deployment& deployment) const {
        deploy(identifier, deployment);
        activate(identifier, deployment);
    }
    void uninstall(const std::string& identifier) const;

    static Deployment named(std::string_view identifier, std::string_view name, std::string_view keys = "");

private:
    std::string path_;
};

}  // namespace cindral::test
