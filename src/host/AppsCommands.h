#pragma once

#include "host/HostEnvironment.h"
#include "host/HostOptions.h"
#include "host/TextOutput.h"
#include "platform/foundation/Result.h"

namespace cindral {

/// The commands about applications: what is installed, whose documents are published and why not those of the others,
/// and a person's choice about one.
///
/// They look at the applications themselves, and work beside a host that runs: it notices what they change. Errors are
/// the host's own, with a line for people.
///
/// `output` is finished by the caller.
Result<void> runAppsCommand(const HostOptions& options, const HostEnvironment& environment, TextOutput& output);

}  // namespace cindral
