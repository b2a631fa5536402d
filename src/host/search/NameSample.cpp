#include "host/search/NameSample.h"

#include <algorithm>
#include <utility>

namespace cindral {
namespace {

// The lists of what holds a gram are read to the end: beyond these, one more costs more than what it leaves out.
constexpr std::size_t kTrigramsMax = 3;

}  // namespace

std::uint64_t NameSample::estimate(std::string_view text) const {
    if (names_.empty()) return 0;
    const auto holds = [&](const std::string& name) { return name.find(text) != std::string::npos; };
    const auto found = static_cast<std::uint64_t>(std::ranges::count_if(names_, holds));
    return std::max<std::uint64_t>(2 * found, 1) * total_ / (2 * names_.size());
}

std::vector<std::string> NameSample::bestGrams(std::string_view text, NameMatch match) const {
    std::vector<std::string> required = name_grams::required(text, match);
    std::vector<std::string> best;
    // What marks a beginning is not in the names as they are sampled; there is one at most, and it says a lot.
    std::erase_if(required, [&](std::string& gram) {
        if (gram.find('/') == std::string::npos) return false;
        best.push_back(std::move(gram));
        return true;
    });
    std::vector<const std::string*> left;
    for (const std::string& name : names_) left.push_back(&name);
    const std::size_t markers = best.size();
    while (!required.empty() && best.size() < markers + kTrigramsMax) {
        std::pair<std::size_t, std::size_t> fewest{left.size() + 1, 0};
        for (std::size_t i = 0; i < required.size(); ++i) {
            const auto holds = [&](const std::string* name) { return name->find(required[i]) != std::string::npos; };
            fewest = std::min(fewest, {static_cast<std::size_t>(std::ranges::count_if(left, holds)), i});
        }
        // One that leaves over what the others do is of no use.
        if (best.size() > markers && fewest.first * 4 > left.size() * 3) break;
        std::string gram = std::move(required[fewest.second]);
        required.erase(required.begin() + static_cast<std::ptrdiff_t>(fewest.second));
        std::erase_if(left, [&](const std::string* name) { return name->find(gram) == std::string::npos; });
        best.push_back(std::move(gram));
        if (left.empty()) break;
    }
    return best;
}

}  // namespace cindral
