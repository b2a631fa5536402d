#pragma once

#include <cstddef>
#include <span>
#include <string_view>

#include "platform/foundation/Result.h"
#include "platform/foundation/UniqueFd.h"

/// Reading and writing of descriptors that may be pipes, terminals or sockets. EINTR and EAGAIN are dealt with here;
/// errors are of the POSIX domain.
namespace cindral::descriptor {

/// A good size of a buffer for lines of requests and answers.
inline constexpr std::size_t kReadBytes = 64 << 10;

/// Bytes read, at least one; 0 at the end of the stream.
Result<std::size_t> read(int fd, std::span<char> buffer);
/// Writes all of it.
Result<void> writeAll(int fd, std::string_view bytes);

enum class Readiness { input, outputGone, interrupted };
/// Waits until `input` can be read, or nobody reads `output` any more, or `interrupt` can be read.
Result<Readiness> waitForInput(int input, int output, int interrupt);

/// A descriptor that becomes readable by interrupt() and stays so.
Result<UniqueFd> makeInterrupt();
void interrupt(const UniqueFd& interrupt);
/// Makes it as it was before.
void clearInterrupt(const UniqueFd& interrupt);
/// Whether something can be read, or nothing ever will be. At once.
bool isReadable(int fd);

/// Lets a pipe hold that many bytes, where it is one and the system allows it.
void enlargePipe(int fd, std::size_t bytes);

/// Makes sure that descriptors 0 to 2 are open, so that no file that is opened later takes the place of one.
void occupyStandardDescriptors();

}  // namespace cindral::descriptor
