#include "platform/revisions/OwnAttributes.h"

#include <sys/xattr.h>

#include <cerrno>
#include <limits>

#include "platform/foundation/Sys.h"
#include "platform/revisions/PackedRecord.h"

namespace cindral::own_attributes {

namespace {

template <typename Integer>
void appendInteger(Bytes& out, Integer value) {
    out.resize(out.size() + sizeof value);
    storeInteger(out.data() + out.size() - sizeof value, value);
}

void appendBytes(Bytes& out, ByteView bytes) {
    out.insert(out.end(), bytes.begin(), bytes.end());
}

/// Takes a sized run of bytes off the front; false when there are too few.
template <typename Size>
bool take(ByteView& from, ByteView& out) {
    if (from.size() < sizeof(Size)) return false;
    const auto size = loadInteger<Size>(from.data());
    if (from.size() - sizeof(Size) < size) return false;
    out = from.subspan(sizeof(Size), size);
    from = from.subspan(sizeof(Size) + size);
    return true;
}

}  // namespace

Result<Bytes> read(int folder, const char* name) {
    Bytes out;
    std::string names;
    if (!TRY(sys::hasXattrs(folder, name, names))) return out;
    for (std::size_t at = 0; at < names.size();) {
        const std::string attribute = names.c_str() + at;
        at += attribute.size() + 1;
        if (!attribute.starts_with(kPrefix) || attribute.size() > std::numeric_limits<std::uint16_t>::max()) continue;
        const Result<std::size_t> size = sys::getxattrat(folder, name, attribute.c_str(), {});
        if (!size.ok() || *size == 0) continue;
        Bytes value(*size);
        const Result<std::size_t> got = sys::getxattrat(folder, name, attribute.c_str(), value);
        // One that changed meanwhile changes the file's status, too: it is read again.
        if (!got.ok()) continue;
        value.resize(*got);
        appendInteger(out, static_cast<std::uint16_t>(attribute.size()));
        appendBytes(out, bytesOf(attribute));
        appendInteger(out, static_cast<std::uint32_t>(value.size()));
        appendBytes(out, value);
    }
    return out;
}

Result<std::size_t> restoreMissing(int file, ByteView attributes) {
    std::size_t put = 0;
    ByteView name, value;
    while (take<std::uint16_t>(attributes, name) && take<std::uint32_t>(attributes, value)) {
        const std::string attribute(textOf(name));
        if (!attribute.starts_with(kPrefix) || attribute.find('\0') != std::string::npos) continue;
        if (::fsetxattr(file, attribute.c_str(), value.data(), value.size(), XATTR_CREATE) == 0) {
            ++put;
        } else if (errno != EEXIST) {
            return KsError::errorWithPOSIXCode();
        }
    }
    return put;
}

}  // namespace cindral::own_attributes
