#include "host/TextOutput.h"

#include <cerrno>

#include "host/Descriptor.h"

namespace cindral {
namespace {

constexpr std::size_t kBufferBytes = 64 << 10;

}  // namespace

TextOutput::TextOutput(int fd, bool isTerminal, char lineEnd)
    : fd_(fd), lineEnd_(lineEnd), bufferBytesMax_(isTerminal ? 0 : kBufferBytes) {}

void TextOutput::line(std::string_view text) {
    buffer_ += text;
    endLine();
}

void TextOutput::endLine() {
    buffer_ += lineEnd_;
    if (buffer_.size() > bufferBytesMax_) flush();
}

std::optional<KsError> TextOutput::finish() {
    flush();
    return error_;
}

void TextOutput::flush() {
    if (!isBroken_) {
        if (auto written = descriptor::writeAll(fd_, buffer_); !written.ok()) {
            isBroken_ = true;
            if (!written.error().isPosix(EPIPE)) error_ = std::move(written).error();
        }
    }
    buffer_.clear();
}

}  // namespace cindral
