#include "platform/foundation/KsError.h"

#include <fmt/format.h>

#include <cerrno>
#include <cstring>

namespace cindral {

KsError::KsError(std::string_view domain, std::int64_t code, UserInfo info)
    : domain_(domain), code_(code), info_(std::make_shared<const UserInfo>(std::move(info))) {}

KsError KsError::posix(int errorNumber, std::string path) {
    return {kKsPOSIXErrorDomain, errorNumber, {{"path", std::move(path)}}};
}

KsError KsError::errorWithPOSIXCode() {
    return posix(errno);
}

const KsError::UserInfo& KsError::userInfo() const {
    static const UserInfo kNone;
    return info_ ? *info_ : kNone;
}

KsError KsError::with(std::string key, std::string value) const {
    UserInfo info = userInfo();
    info.insert_or_assign(std::move(key), std::move(value));
    KsError error(domain_, code_, std::move(info));
    error.attachment_ = attachment_;
    return error;
}

KsError KsError::withAttachment(std::shared_ptr<const KsErrorAttachment> attachment) const {
    KsError error = *this;
    error.attachment_ = std::move(attachment);
    return error;
}

std::string KsError::reason() const {
    if (domain_ == kKsPOSIXErrorDomain) {
        char buffer[128];
        return ::strerror_r(static_cast<int>(code_), buffer, sizeof buffer);
    }
    if (domain_ == kKsGeneralErrorDomain) {
        switch (code_) {
            case kKsFileNoSuchFileError: return "The file doesn't exist";
            case kKsFileWriteNoPermissionError: return "You don't have permission to write there";
            case kKsFileWriteFileExistsError: return "A file with that name already exists";
            default: break;
        }
    }
    const auto message = userInfo().find("message");
    return message != userInfo().end() ? message->second : std::string("The operation couldn't be completed");
}

std::string KsError::description() const {
    return fmt::format("{} ({} {})", reason(), domain_, code_);
}

}  // namespace cindral
