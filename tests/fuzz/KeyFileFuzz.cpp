// What a key file holds can be written as one, and read again as the same.

#include <cstdlib>
#include <string>

#include "platform/roster/KeyFile.h"

using namespace cindral;  // NOLINT(google-build-using-namespace)

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    const auto file = KeyFile::parse(text);
    const auto locales = localeNames(text);
    if (!file) return 0;
    std::string written;
    for (const std::string& group : file->groups()) {
        if (!file->hasGroup(group)) std::abort();
        written += "[" + group + "]\n";
        for (const std::string& key : file->keys(group)) {
            const std::string* value = file->value(group, key);
            if (value == nullptr || !file->string(group, key)) std::abort();
            if (file->boolean(group, key) && *value != "true" && *value != "false") std::abort();
            // As it stands, or for one of the locales.
            if (!file->localizedString(group, key, locales)) std::abort();
            written += key + "=" + *value + "\n";
        }
    }
    if (written.size() > KeyFile::kBytesMax) return 0;
    const auto again = KeyFile::parse(written);
    if (!again || again->groups() != file->groups()) std::abort();
    for (const std::string& group : file->groups()) {
        if (again->keys(group) != file->keys(group)) std::abort();
        for (const std::string& key : file->keys(group)) {
            if (*again->value(group, key) != *file->value(group, key)) std::abort();
        }
    }
    return 0;
}
