// Reads binary property lists from standard input, one a line in hexadecimal digits, and says of each what it holds and
// how we write it: "VALUE BYTES", or "refused". For plistlib_check.py, which compares both with an independent
// implementation.

#include <fmt/format.h>

#include <bit>
#include <iostream>
#include <string>

#include "platform/foundation/PropertyList.h"
#include "support/Hex.h"

namespace cindral {
namespace {

std::string describe(const std::string& string) {
    return "s" + test::hexFromBytes(bytesOf(string));
}

std::string describe(const PropertyList& value) {
    if (const auto* boolean = value.boolean()) return *boolean ? "true" : "false";
    if (const auto* integer = value.unsignedInteger()) return fmt::format("i{}", *integer);
    if (const auto* integer = value.negativeInteger()) return fmt::format("i{}", *integer);
    if (const auto* real = value.real()) return fmt::format("r{:016x}", std::bit_cast<std::uint64_t>(*real));
    if (const auto* date = value.date()) return fmt::format("d{}.{:09}", date->seconds, date->nanoseconds);
    if (const auto* data = value.data()) return "x" + test::hexFromBytes(*data);
    if (const auto* string = value.string()) return describe(*string);
    std::string text;
    if (const auto* array = value.array()) {
        for (const PropertyList& element : *array) text += describe(element) + ",";
        return "[" + text + "]";
    }
    for (const auto& [key, element] : *value.dictionary()) text += describe(key) + ":" + describe(element) + ",";
    return "{" + text + "}";
}

}  // namespace
}  // namespace cindral

int main() {
    std::string line;
    while (std::getline(std::cin, line)) {
        const auto list = cindral::PropertyList::decodeBinary(cindral::test::bytesFromHex(line));
        if (list) {
            std::cout << cindral::describe(*list) << ' ' << cindral::test::hexFromBytes(list->encodeBinary()) << '\n';
        } else {
            std::cout << "refused\n";
        }
    }
}
