#pragma once

#include <string>
#include <vector>

#include "host/ErrorLog.h"
#include "host/PresentedPaths.h"
#include "host/search/SearchIndex.h"
#include "platform/eventstream/Recorder.h"

namespace cindral {

/// Something that is not as it should be, in words for people.
struct HealthProblem {
    std::string what;
    std::string remedy;  ///< what a person can do about it
    bool operator==(const HealthProblem&) const = default;
};

/// What a host knows of its parts.
struct HealthSources {
    const PresentedPaths& paths;
    std::string state;
    const Recorder::Status& recorder;
    std::optional<KsError> storeFailure;
    const SearchIndex::Status& search;
    ErrorLog::Recent errors;
};

/// Looks at the folders as they are now, and at what the parts say of themselves. Empty where all is well. What works,
/// only slower, for a reason that nobody can do anything about is no problem.
std::vector<HealthProblem> findHealthProblems(const HealthSources& sources);

}  // namespace cindral
