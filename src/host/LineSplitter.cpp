#include "host/LineSplitter.h"

namespace cindral {
namespace {

// A buffer that grew for one long line is given back after it.
constexpr std::size_t kKeptBytesMax = 1 << 20;

}  // namespace

void LineSplitter::feed(std::string_view bytes) {
    while (!bytes.empty()) {
        const std::size_t newline = bytes.find('\n');
        const bool isWhole =
            line_.empty() && !isTooLong_ && newline != std::string_view::npos && newline <= lineBytesMax_;
        if (isWhole) {
            receiver_.didReadLine(bytes.substr(0, newline));
        } else {
            append(bytes.substr(0, newline));
            if (newline == std::string_view::npos) return;
            endLine();
        }
        bytes.remove_prefix(newline + 1);
    }
}

void LineSplitter::finish() {
    if (!line_.empty() || isTooLong_) endLine();
}

void LineSplitter::append(std::string_view bytes) {
    if (isTooLong_) return;
    if (bytes.size() > lineBytesMax_ - line_.size()) {
        isTooLong_ = true;
        line_ = std::string();
        return;
    }
    line_ += bytes;
}

void LineSplitter::endLine() {
    if (isTooLong_) {
        receiver_.didSkipLongLine();
    } else {
        receiver_.didReadLine(line_);
    }
    isTooLong_ = false;
    line_.clear();
    if (line_.capacity() > kKeptBytesMax) line_ = std::string();
}

}  // namespace cindral
