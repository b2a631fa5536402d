#pragma once

#include <cstddef>
#include <functional>
#include <string>
#include <string_view>

namespace cindral {

/// Cuts a stream of bytes into lines, and bounds what one line may cost.
///
/// A line that is longer than the limit is skipped to its end; its bytes are not kept.
///
/// Thread safety: for one thread at a time.
class LineSplitter {
public:
    class Receiver {
    public:
        virtual ~Receiver() = default;
        /// Without the newline; borrowed for the call.
        virtual void didReadLine(std::string_view line) = 0;
        virtual void didSkipLongLine() = 0;
    };

    /// `receiver` is borrowed for life.
    LineSplitter(Receiver& receiver, std::size_t lineBytesMax) : receiver_(receiver), lineBytesMax_(lineBytesMax) {}

    void feed(std::string_view bytes);
    /// The stream is over: what stands after the last newline is a line too.
    void finish();

private:
    void append(std::string_view bytes);
    void endLine();

    Receiver& receiver_;
    const std::size_t lineBytesMax_;
    std::string line_;
    bool isTooLong_ = false;
};

}  // namespace cindral
