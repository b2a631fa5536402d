#include "support/FlatpakTree.h"

#include <fmt/format.h>

#include <filesystem>
#include <fstream>

namespace cindral::test {
namespace {

namespace fs = std::filesystem;

void writeFile(const fs::path& path, std::string_view contents) {
    fs::create_directories(path.parent_path());
    std::ofstream stream(path, std::ios::binary);
    stream << contents;
    if (!stream.flush()) std::abort();
}

void replaceLink(const fs::path& link, const fs::path& target) {
    const fs::path temporary = link.parent_path() / ".link-XXXX";
    fs::create_directories(link.parent_path());
    fs::create_symlink(target, temporary);
    fs::rename(temporary, link);
}

}  // namespace

FlatpakTree::Deployment FlatpakTree::named(std::string_view identifier, std::string_view name, std::string_view keys) {
    Deployment deployment;
    deployment.metadata = fmt::format(
        "[Application]\nname={}\nruntime=org.example.Platform/x86_64/23.08\n\n[Context]\nshared=ipc;\n", identifier);
    deployment.entry = fmt::format(
        "[Desktop Entry]\nType=Application\nName={}\nIcon={}\nExec=/usr/bin/flatpak run {}\nX-Flatpak={}\n{}", name,
        identifier, identifier, identifier, keys);
    return deployment;
}

std::string FlatpakTree::deploy(const std::string& identifier, const Deployment& deployment) const {
    const fs::path folder = fs::path(path_) / "app" / identifier / "x86_64" / deployment.branch / deployment.commit;
    fs::create_directories(folder / "files");
    writeFile(folder / "deploy", "");
    if (!deployment.metadata.empty()) writeFile(folder / "metadata", deployment.metadata);
    if (!deployment.entry.empty())
        writeFile(folder / "export/share/applications" / (identifier + ".desktop"), deployment.entry);
    return folder;
}

void FlatpakTree::activate(const std::string& identifier, const Deployment& deployment) const {
    const fs::path application = fs::path(path_) / "app" / identifier;
    replaceLink(application / "x86_64" / deployment.branch / "active", deployment.commit);
    replaceLink(application / "current", fs::path("x86_64") / deployment.branch);
    const fs::path exported = fs::path(path_) / "exports/share/applications" / (identifier + ".desktop");
    if (!deployment.entry.empty())
        replaceLink(exported, fs::path("../../../app") / identifier / "current/active/export/share/applications" /
                                  (identifier + ".desktop"));
    writeFile(fs::path(path_) / ".changed", "");
}

void FlatpakTree::uninstall(const std::string& identifier) const {
    fs::remove(fs::path(path_) / "exports/share/applications" / (identifier + ".desktop"));
    fs::remove_all(fs::path(path_) / "app" / identifier);
    writeFile(fs::path(path_) / ".changed", "");
}

}  // namespace cindral::test
