#include "host/http/HttpSessions.h"

#include <sys/random.h>

#include <array>
#include <cerrno>
#include <utility>

#include "platform/foundation/Fatal.h"

namespace cindral {
namespace {

constexpr std::size_t kSecretBytes = 32;

std::string newSecret() {
    std::array<unsigned char, kSecretBytes> bytes{};
    std::size_t got = 0;
    while (got < bytes.size()) {
        const ssize_t more = ::getrandom(bytes.data() + got, bytes.size() - got, 0);
        if (more < 0 && errno != EINTR) fatal("the kernel has no random bytes");
        if (more > 0) got += static_cast<std::size_t>(more);
    }
    constexpr std::string_view kDigits = "0123456789abcdef";
    std::string secret;
    for (const unsigned char byte : bytes) {
        secret += kDigits[byte >> 4];
        secret += kDigits[byte & 15];
    }
    return secret;
}

}  // namespace

bool HttpSessions::areEqual(std::string_view a, std::string_view b) {
    if (a.size() != b.size()) return false;
    unsigned difference = 0;
    for (std::size_t i = 0; i < a.size(); ++i) difference |= static_cast<unsigned char>(a[i] ^ b[i]);
    return difference == 0;
}

std::string HttpSessions::makeLink() {
    std::string secret = newSecret();
    const MutexLock lock(mutex_);
    links_.push_back(secret);
    if (links_.size() > kLinksMax) links_.pop_front();
    return secret;
}

std::shared_ptr<const HttpSession> HttpSessions::trade(std::string_view link, Clock::time_point now) {
    const MutexLock lock(mutex_);
    const std::size_t before = links_.size();
    std::erase_if(links_, [&](const std::string& each) { return areEqual(each, link); });
    if (links_.size() == before) return nullptr;
    auto session = std::make_shared<const HttpSession>(HttpSession{newSecret(), newSecret()});
    sessions_.push_back({session, now + kLifetime});
    if (sessions_.size() > kSessionsMax) sessions_.pop_front();
    return session;
}

std::shared_ptr<const HttpSession> HttpSessions::find(std::string_view cookie, Clock::time_point now) {
    const MutexLock lock(mutex_);
    std::erase_if(sessions_, [&](const Entry& entry) { return entry.end <= now; });
    std::shared_ptr<const HttpSession> found;
    for (const Entry& entry : sessions_) {
        if (areEqual(entry.session->cookie, cookie)) found = entry.session;
    }
    return found;
}

void HttpSessions::end(const HttpSession& session) {
    const MutexLock lock(mutex_);
    std::erase_if(sessions_, [&](const Entry& entry) { return areEqual(entry.session->cookie, session.cookie); });
}

}  // namespace cindral
