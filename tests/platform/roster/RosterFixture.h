#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "platform/roster/RosterScanner.h"
#include "support/FlatpakTree.h"
#include "support/LogCapture.h"
#include "support/TemporaryFolder.h"

namespace cindral::test {

/// Sources of applications in a folder of the test's own, and verbs to install into them.
class RosterSourcesTest : public ::testing::Test {
protected:
    RosterSourcesTest() {
        sources_.flatpakUser = user_.path();
        sources_.flatpakSystem = system_.path();
        sources_.flatpakConfig = folder_ / "etc";
        sources_.applicationData = folder_ / "home/.var/app";
        sources_.home = folder_ / "home";
        sources_.entryFolders = {folder_ / "entries"};
        sources_.choicesFile = folder_ / "config/applications.conf";
        sources_.dataFolders = {folder_ / "share"};
        sources_.storage = folder_.folder("home/Documents");
    }

    /// What the provider shows of an application, once its keys say so.
    std::string makeContainer(const std::string& identifier) const {
        folder_.folder("home/.var/app/" + identifier + "/Documents");
        return folder_ / ("home/.var/app/" + identifier);
    }
    std::string entry(std::string_view name, std::string_view keys = "") const {
        return "[Desktop Entry]\nType=Application\nName=" + std::string(name) + "\n" + std::string(keys);
    }
    void installEntry(const std::string& identifier, const std::string& contents) const {
        folder_.file("entries/" + identifier + ".desktop", contents);
    }

    TemporaryFolder folder_;
    FlatpakTree user_{folder_ / "user"};
    FlatpakTree system_{folder_ / "system"};
    RosterSources sources_;
};

}  // namespace cindral::test
