#include "host/search/NameCollation.h"

#include <fmt/format.h>
#include <unicode/coll.h>
#include <unicode/unistr.h>

#include <cstdlib>
#include <vector>

namespace cindral {

struct NameCollation::Implementation {
    std::unique_ptr<icu::Collator> collator;  ///< null only where the library is without its data
};

NameCollation::NameCollation(const std::string& locale) : implementation_(std::make_unique<Implementation>()) {
    const std::string language = locale.substr(0, locale.find_first_of(".@"));
    const bool isPlain = language.empty() || language == "C" || language == "POSIX";
    const icu::Locale named = isPlain ? icu::Locale::getRoot() : icu::Locale::createCanonical(language.c_str());
    UErrorCode status = U_ZERO_ERROR;
    implementation_->collator.reset(icu::Collator::createInstance(named, status));
    if (U_SUCCESS(status)) implementation_->collator->setAttribute(UCOL_NUMERIC_COLLATION, UCOL_ON, status);
    if (U_FAILURE(status)) {
        implementation_->collator.reset();
        version_ = "bytes";
        return;
    }
    UVersionInfo version;
    implementation_->collator->getVersion(version);
    version_ = fmt::format("{}/{}.{}.{}.{}", named.getName(), version[0], version[1], version[2], version[3]);
}

NameCollation::~NameCollation() = default;

std::string NameCollation::localeOfProcess() {
    for (const char* variable : {"LC_ALL", "LC_COLLATE", "LANG"}) {
        const char* value = std::getenv(variable);
        if (value != nullptr && *value != '\0') return value;
    }
    return "";
}

std::string NameCollation::key(std::string_view name) const {
    if (!implementation_->collator) return std::string(name);
    const icu::UnicodeString text =
        icu::UnicodeString::fromUTF8(icu::StringPiece(name.data(), static_cast<int32_t>(name.size())));
    std::string key(64, '\0');
    while (true) {
        const int32_t needed = implementation_->collator->getSortKey(text, reinterpret_cast<std::uint8_t*>(key.data()),
                                                                     static_cast<int32_t>(key.size()));
        const bool fits = needed <= static_cast<int32_t>(key.size());
        // The last byte is a NUL, and says nothing.
        key.resize(static_cast<std::size_t>(fits ? needed - 1 : needed));
        if (fits) return key;
    }
}

}  // namespace cindral
