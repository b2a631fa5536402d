#pragma once

#include <string>
#include <vector>

namespace cindral {

/// The status of a host in words, for people.
struct StatusReport {
    std::string text;  ///< lines
    /// Things that are not as they should be; each has its line in the text, and what can be done about it.
    std::size_t problems = 0;

    /// From the JSON text that `status` answers. Fields that are not there are left out.
    static StatusReport of(const std::string& json);
};

/// What a host's doctor did, in words for people.
struct DoctorReport {
    std::string text;  ///< lines
    std::string json;  ///< for programs
    std::size_t problems = 0;

    /// From the JSON text that `doctor` answers, and where what stopped the start was put before.
    static DoctorReport of(const std::string& json, const std::vector<std::string>& setAside);
};

}  // namespace cindral
