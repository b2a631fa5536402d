#include "platform/foundation/KsDate.h"

#include <array>

namespace cindral {

namespace {

constexpr std::int64_t kSecondsPerDay = 86'400;

struct CivilDate {
    std::int64_t year;
    unsigned month;  // 1 to 12
    unsigned day;    // 1 to 31
};

// The calendar in eras of 400 years that begin on 1 March, so that a leap day is the last day of its year and months
// need no table. The C library's conversions take a lock and read the time zone's file; a listing makes three of these
// for each of its items.
constexpr std::int64_t kDaysPerEra = 146'097;
constexpr std::int64_t kDaysFromEraTo1970 = 719'468;  // From 0000-03-01 to 1970-01-01.

constexpr CivilDate civilFromDays(std::int64_t daysSince1970) {
    const std::int64_t days = daysSince1970 + kDaysFromEraTo1970;
    const std::int64_t era = (days >= 0 ? days : days - (kDaysPerEra - 1)) / kDaysPerEra;
    const auto dayOfEra = static_cast<unsigned>(days - era * kDaysPerEra);
    const unsigned yearOfEra = (dayOfEra - dayOfEra / 1'460 + dayOfEra / 36'524 - dayOfEra / 146'096) / 365;
    const unsigned dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
    const unsigned monthFromMarch = (5 * dayOfYear + 2) / 153;
    const unsigned day = dayOfYear - (153 * monthFromMarch + 2) / 5 + 1;
    const unsigned month = monthFromMarch < 10 ? monthFromMarch + 3 : monthFromMarch - 9;
    return {.year = era * 400 + yearOfEra + (month <= 2 ? 1 : 0), .month = month, .day = day};
}

constexpr std::int64_t daysFromCivil(const CivilDate& date) {
    const std::int64_t year = date.month <= 2 ? date.year - 1 : date.year;
    const std::int64_t era = (year >= 0 ? year : year - 399) / 400;
    const auto yearOfEra = static_cast<unsigned>(year - era * 400);
    const unsigned monthFromMarch = date.month > 2 ? date.month - 3 : date.month + 9;
    const unsigned dayOfYear = (153 * monthFromMarch + 2) / 5 + date.day - 1;
    const unsigned dayOfEra = yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear;
    return era * kDaysPerEra + dayOfEra - kDaysFromEraTo1970;
}

static_assert(daysFromCivil({.year = 1970, .month = 1, .day = 1}) == 0);
static_assert(civilFromDays(0).year == 1970);

constexpr bool isLeapYear(unsigned year) {
    return year % 4 == 0 && (year % 100 != 0 || year % 400 == 0);
}

constexpr unsigned daysOfMonth(unsigned year, unsigned month) {
    if (month == 2) return isLeapYear(year) ? 29 : 28;
    return month == 4 || month == 6 || month == 9 || month == 11 ? 30 : 31;
}

template <unsigned kDigits>
char* writeDigits(char* out, std::uint32_t value) {
    for (unsigned i = kDigits; i > 0; --i) {
        out[i - 1] = static_cast<char>('0' + value % 10);
        value /= 10;
    }
    return out + kDigits;
}

char* writeYear(char* out, std::int64_t year) {
    if (year >= 0 && year <= 9'999) return writeDigits<4>(out, static_cast<std::uint32_t>(year));
    *out++ = year < 0 ? '-' : '+';
    auto rest = static_cast<std::uint64_t>(year < 0 ? -year : year);
    std::array<char, 20> reversed;
    std::size_t digits = 0;
    for (; rest != 0; rest /= 10) reversed[digits++] = static_cast<char>('0' + rest % 10);
    while (digits != 0) *out++ = reversed[--digits];
    return out;
}

char* writeFraction(char* out, std::uint32_t nanoseconds) {
    if (nanoseconds == 0) return out;
    *out++ = '.';
    out = writeDigits<9>(out, nanoseconds);
    while (out[-1] == '0') --out;
    return out;
}

/// Takes a text apart from its beginning; once something did not fit, nothing fits any more.
class Scanner {
public:
    explicit Scanner(std::string_view text) : rest_(text) {}

    /// Exactly that many decimal digits.
    unsigned digits(unsigned count) {
        unsigned value = 0;
        for (unsigned i = 0; i < count; ++i) value = value * 10 + digit();
        return value;
    }
    unsigned digit() {
        if (!nextIsDigit()) return failed();
        const auto value = static_cast<unsigned>(rest_.front() - '0');
        rest_.remove_prefix(1);
        return value;
    }
    void literal(char character) {
        if (!skip(character)) failed();
    }
    bool skip(char character) {
        if (rest_.empty() || rest_.front() != character) return false;
        rest_.remove_prefix(1);
        return true;
    }
    bool nextIsDigit() const { return !rest_.empty() && rest_.front() >= '0' && rest_.front() <= '9'; }
    bool atEnd() const { return good_ && rest_.empty(); }

private:
    unsigned failed() {
        good_ = false;
        rest_ = {};
        return 0;
    }

    std::string_view rest_;
    bool good_ = true;
};

std::uint32_t scanFraction(Scanner& scanner) {
    if (!scanner.skip('.')) return 0;
    std::uint32_t value = scanner.digit();
    unsigned digits = 1;
    for (; digits < 9 && scanner.nextIsDigit(); ++digits) value = value * 10 + scanner.digit();
    for (; digits < 9; ++digits) value *= 10;
    return value;  // A tenth decimal is left over, and so refused by the caller.
}

/// Seconds east of UTC; none for an offset of no clock.
std::optional<int> scanOffset(Scanner& scanner) {
    if (scanner.skip('Z') || scanner.skip('z')) return 0;
    const bool west = scanner.skip('-');
    if (!west) scanner.literal('+');
    const unsigned hours = scanner.digits(2);
    scanner.literal(':');
    const unsigned minutes = scanner.digits(2);
    if (hours > 23 || minutes > 59) return std::nullopt;
    const int seconds = static_cast<int>(hours * 3'600 + minutes * 60);
    return west ? -seconds : seconds;
}

/// Leap seconds are put in after the last minute of a month, in UTC.
bool mayFollowALeapSecond(std::int64_t seconds) {
    return seconds % kSecondsPerDay == 0 && civilFromDays(seconds / kSecondsPerDay).day == 1;
}

}  // namespace

KsDate KsDate::now() {
    timespec time{};
    ::clock_gettime(CLOCK_REALTIME, &time);
    return from(time);
}

KsDate KsDate::from(const timespec& time) {
    return {.seconds = time.tv_sec, .nanoseconds = static_cast<std::uint32_t>(time.tv_nsec)};
}

void KsDate::appendRFC3339(std::string& out) const {
    const std::int64_t remainder = seconds % kSecondsPerDay;
    const auto secondOfDay = static_cast<std::uint32_t>(remainder < 0 ? remainder + kSecondsPerDay : remainder);
    const CivilDate date = civilFromDays(seconds / kSecondsPerDay - (remainder < 0 ? 1 : 0));

    std::array<char, 48> text;  // The longest has 40 characters: a sign and a year of 12 digits, and a full fraction.
    char* end = writeYear(text.data(), date.year);
    *end++ = '-';
    end = writeDigits<2>(end, date.month);
    *end++ = '-';
    end = writeDigits<2>(end, date.day);
    *end++ = 'T';
    end = writeDigits<2>(end, secondOfDay / 3'600);
    *end++ = ':';
    end = writeDigits<2>(end, secondOfDay / 60 % 60);
    *end++ = ':';
    end = writeDigits<2>(end, secondOfDay % 60);
    end = writeFraction(end, nanoseconds);
    *end++ = 'Z';
    out.append(text.data(), static_cast<std::size_t>(end - text.data()));
}

std::string KsDate::rfc3339() const {
    std::string text;
    appendRFC3339(text);
    return text;
}

std::optional<KsDate> KsDate::parseRFC3339(std::string_view text) {
    Scanner scanner(text);
    const unsigned year = scanner.digits(4);
    scanner.literal('-');
    const unsigned month = scanner.digits(2);
    scanner.literal('-');
    const unsigned day = scanner.digits(2);
    if (!scanner.skip('t')) scanner.literal('T');
    const unsigned hour = scanner.digits(2);
    scanner.literal(':');
    const unsigned minute = scanner.digits(2);
    scanner.literal(':');
    const unsigned second = scanner.digits(2);
    const std::uint32_t fraction = scanFraction(scanner);
    const std::optional<int> offset = scanOffset(scanner);

    if (!scanner.atEnd() || !offset) return std::nullopt;
    if (month < 1 || month > 12 || day < 1 || day > daysOfMonth(year, month)) return std::nullopt;
    if (hour > 23 || minute > 59 || second > 60) return std::nullopt;

    const std::int64_t days = daysFromCivil({.year = year, .month = month, .day = day});
    // A leap second has no number of its own: it is counted as the second that follows it, as the kernel's clock does.
    const unsigned secondOfDay = hour * 3'600 + minute * 60 + second;
    const std::int64_t seconds = days * kSecondsPerDay + secondOfDay - *offset;
    if (second == 60 && !mayFollowALeapSecond(seconds)) return std::nullopt;
    return KsDate{.seconds = seconds, .nanoseconds = fraction};
}

}  // namespace cindral
