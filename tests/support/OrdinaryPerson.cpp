#include "support/OrdinaryPerson.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>

namespace cindral::test {

namespace {

constexpr uid_t kSomebody = 65'533;

}  // namespace

OrdinaryPerson::OrdinaryPerson() : wasRoot_(::geteuid() == 0) {
    if (wasRoot_ && (::setegid(kSomebody) != 0 || ::seteuid(kSomebody) != 0)) std::abort();
}

OrdinaryPerson::~OrdinaryPerson() {
    if (wasRoot_ && (::seteuid(0) != 0 || ::setegid(0) != 0)) std::abort();
}

void OrdinaryPerson::giveTo(const std::string& path) {
    if (::geteuid() != 0) return;
    if (::lchown(path.c_str(), kSomebody, kSomebody) != 0) std::abort();
    for (const auto& entry : std::filesystem::recursive_directory_iterator(path)) {
        if (::lchown(entry.path().c_str(), kSomebody, kSomebody) != 0) std::abort();
    }
}

}  // namespace cindral::test
