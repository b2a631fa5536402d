#pragma once

#include <string>
#include <string_view>

namespace cindral {

/// One of a small set of texts (type identifiers, bundle identifiers) that live as long as the process.
///
/// Copies cost a pointer, and equal texts have equal pointers. Meant for texts whose number is bounded
/// by what is installed, never for what a file or a client may name.
///
/// Thread safety: a value; making one from text takes a process-wide lock.
class InternedString {
public:
    InternedString() = default;  ///< the empty text
    explicit InternedString(std::string_view text);

    const std::string& string() const { return *text_; }
    std::string_view view() const { return *text_; }
    bool empty() const { return text_->empty(); }
    friend bool operator==(InternedString a, InternedString b) { return a.text_ == b.text_; }

private:
    static const std::string kEmpty;
    const std::string* text_ = &kEmpty;
};

}  // namespace cindral
