#pragma once

#include <span>
#include <string>

#include "host/HostEnvironment.h"
#include "host/HostProcess.h"
#include "platform/tessel/TesselExtension.h"

namespace cindral {

/// What the program does with the words after its name. Answers its exit status.
int runProgram(std::span<const std::string> words, const HostEnvironment& environment,
               TesselExtensionFactory makeProvider, ProviderRepair repairProvider);

}  // namespace cindral
