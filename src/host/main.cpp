#include <csignal>
#include <string>
#include <vector>

#include "host/Descriptor.h"
#include "host/HostEnvironment.h"
#include "host/Program.h"
#include "provider/CindralProvider.h"

int main(int argc, char** argv) {
    cindral::descriptor::occupyStandardDescriptors();
    // A reader that goes away is told by the write.
    std::signal(SIGPIPE, SIG_IGN);
    const std::vector<std::string> words(argv + (argc > 0 ? 1 : 0), argv + argc);
    return cindral::runProgram(words, cindral::HostEnvironment::ofProcess(), &cindral::makeCindralProvider,
                               &cindral::repairCindralProvider);
}
