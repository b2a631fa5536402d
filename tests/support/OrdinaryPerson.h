#pragma once

#include <string>

namespace cindral::test {

/// An ordinary person for as long as it lives, where the test runs as root; the process's own identity otherwise.
class OrdinaryPerson {
public:
    OrdinaryPerson();
    ~OrdinaryPerson();
    OrdinaryPerson(const OrdinaryPerson&) = delete;
    OrdinaryPerson& operator=(const OrdinaryPerson&) = delete;

    /// Gives the tree to that person; to be called before there is one.
    static void giveTo(const std::string& path);

private:
    const bool wasRoot_;
};

}  // namespace cindral::test
