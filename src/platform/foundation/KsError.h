#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <string_view>

namespace cindral {

/// Domains of errors. Each is a string that lives as long as the process, compared by text.
inline constexpr std::string_view kKsPOSIXErrorDomain = "KsPOSIXErrorDomain";
inline constexpr std::string_view kKsGeneralErrorDomain = "KsGeneralErrorDomain";

/// Codes of KsGeneralErrorDomain. Part of the host interface: add numbers, never change one.
inline constexpr std::int64_t kKsFileNoSuchFileError = 260;
inline constexpr std::int64_t kKsFileWriteNoPermissionError = 513;
inline constexpr std::int64_t kKsFileWriteFileExistsError = 516;

/// What an error holds besides texts. Whoever made it knows the type.
struct KsErrorAttachment {
    KsErrorAttachment() = default;
    virtual ~KsErrorAttachment() = default;
    KsErrorAttachment(const KsErrorAttachment&) = delete;
    KsErrorAttachment& operator=(const KsErrorAttachment&) = delete;
};

/// What went wrong: a domain, a code within it, and optionally named texts that say with what.
///
/// In the POSIX domain the code is an errno value.
///
/// Thread safety: a value; the named texts are shared and never change.
class KsError {
public:
    using UserInfo = std::map<std::string, std::string, std::less<>>;

    /// `domain` must live as long as the process.
    KsError(std::string_view domain, std::int64_t code) : domain_(domain), code_(code) {}
    KsError(std::string_view domain, std::int64_t code, UserInfo info);

    static KsError posix(int errorNumber) { return {kKsPOSIXErrorDomain, errorNumber}; }
    static KsError posix(int errorNumber, std::string path);
    /// The error of the last failed system call, without named texts.
    static KsError errorWithPOSIXCode();
    static KsError errorFileWriteNoPermission() { return {kKsGeneralErrorDomain, kKsFileWriteNoPermissionError}; }

    std::string_view domain() const { return domain_; }
    std::int64_t code() const { return code_; }
    bool is(std::string_view domain, std::int64_t code) const { return domain_ == domain && code_ == code; }
    bool isPosix(int errorNumber) const { return is(kKsPOSIXErrorDomain, errorNumber); }

    /// Named texts ("path", "identifier", "parameter", "value"); empty when there are none.
    const UserInfo& userInfo() const;
    KsError with(std::string key, std::string value) const;

    KsError withAttachment(std::shared_ptr<const KsErrorAttachment> attachment) const;
    /// Null when there is none.
    const KsErrorAttachment* attachment() const { return attachment_.get(); }

    /// A line for people: what the code means, and the domain and code themselves.
    std::string description() const;
    /// What the code means, for a message on a terminal: "No such file or directory".
    std::string reason() const;

    friend bool operator==(const KsError& a, const KsError& b) { return a.domain_ == b.domain_ && a.code_ == b.code_; }

private:
    std::string_view domain_;
    std::int64_t code_;
    std::shared_ptr<const UserInfo> info_;
    std::shared_ptr<const KsErrorAttachment> attachment_;
};

}  // namespace cindral
