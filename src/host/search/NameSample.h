#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "host/search/NameFolding.h"

namespace cindral {

/// Some names of the index, from which it is told beforehand how many there are of a kind.
///
/// It decides how an answer is come by and what that costs, never what the answer is.
///
/// Thread safety: immutable.
class NameSample {
public:
    /// Enough to tell one in a thousand from one in a hundred.
    static constexpr std::size_t kNamesMax = 2'048;

    NameSample() = default;
    /// `names` are folded, `total` is how many there are in all.
    NameSample(std::vector<std::string> names, std::uint64_t total) : names_(std::move(names)), total_(total) {}

    std::uint64_t total() const { return total_; }
    /// About how many names hold the text; none in the sample counts as half a one.
    std::uint64_t estimate(std::string_view text) const;
    /// The few grams, of those that every such name holds (name_grams::required), that leave the fewest others over.
    std::vector<std::string> bestGrams(std::string_view text, NameMatch match) const;

private:
    std::vector<std::string> names_;
    std::uint64_t total_ = 0;
};

}  // namespace cindral
