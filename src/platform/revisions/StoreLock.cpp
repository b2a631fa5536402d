#include "platform/revisions/StoreLock.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <unistd.h>

#include <cerrno>

namespace cindral {

namespace {

constexpr std::size_t kNoteBytesMax = 200;

std::string firstLine(const Bytes& bytes) {
    const std::string_view text = textOf(ByteView(bytes).first(std::min(bytes.size(), kNoteBytesMax)));
    return std::string(text.substr(0, text.find('\n')));
}

std::string pidOf(const std::string& note) {
    const bool isPid = !note.empty() && note.find_first_not_of("0123456789") == std::string::npos;
    return isPid ? note : "unknown";  // In the instant between its taking the lock and its writing the pid.
}

}  // namespace

Result<StoreLock> StoreLock::acquire(int folder, const std::string& folderPath) {
    StoreLock lock;
    lock.file_ = TRY(StoreFile::open(folder, kName));
    // Of the open file, not of the process: a second store in the same process is refused as well, and closing
    // some other descriptor of the file lets nothing go.
    struct flock whole {};
    whole.l_type = F_WRLCK;
    whole.l_whence = SEEK_SET;
    const int answer = ::fcntl(lock.file_.descriptor(), F_OFD_SETLK, &whole);
    const int code = answer == 0 ? 0 : errno;
    lock.noteOfLastHolder_ = firstLine(TRY(lock.file_.readAll()));
    if (code == EAGAIN || code == EACCES) {
        return KsError::posix(EBUSY, folderPath).with("holder", pidOf(lock.noteOfLastHolder_));
    }
    if (code != 0) return KsError::posix(code, folderPath);
    lock.leaveNote(fmt::format("{}", ::getpid()));
    return lock;
}

void StoreLock::leaveNote(const std::string& note) {
    // On a full disk there is no note: the holder is then "unknown", and the next one looks at everything.
    if (!file_.truncate(0).ok()) return;
    (void)file_.writeAt(0, bytesOf(note + "\n"));
}

}  // namespace cindral
