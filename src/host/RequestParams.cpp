#include "host/RequestParams.h"

#include <fmt/format.h>

#include <limits>

#include "platform/foundation/Base64.h"

namespace cindral {

std::nullopt_t RequestParams::refuse(std::string_view message) const {
    reply_.error(JsonRpcCode::invalidParams, message);
    return std::nullopt;
}

std::optional<std::string> RequestParams::string(const char* name) const {
    const auto found = params_.find(name);
    if (found == params_.end()) return refuse(fmt::format("\"{}\" is missing", name));
    if (!found->is_string()) return refuse(fmt::format("\"{}\" is not a string", name));
    return found->get<std::string>();
}

bool RequestParams::optionalString(const char* name, std::optional<std::string>& value) const {
    if (!has(name) || isNull(name)) return true;
    value = string(name);
    return value.has_value();
}

bool RequestParams::optionalFilename(std::optional<std::string>& value) const {
    if (!has("encodedName")) return optionalString("name", value);
    value = filename();
    return value.has_value();
}

std::optional<std::string> RequestParams::filename() const {
    if (!has("encodedName")) return string("name");
    if (has("name")) return refuse("one of \"name\" and \"encodedName\" is needed");
    const auto text = string("encodedName");
    if (!text) return std::nullopt;
    auto name = percentDecoded(*text);
    if (!name) return refuse("\"encodedName\" is not percent-encoded");
    return name;
}

bool RequestParams::optionalBoolean(const char* name, bool& value) const {
    if (!has(name) || isNull(name)) return true;
    const Json& given = params_.at(name);
    if (!given.is_boolean()) {
        refuse(fmt::format("\"{}\" is neither true nor false", name));
        return false;
    }
    value = given.get<bool>();
    return true;
}

std::optional<std::vector<std::string>> RequestParams::strings(const char* name) const {
    const auto found = params_.find(name);
    if (found == params_.end()) return refuse(fmt::format("\"{}\" is missing", name));
    if (!found->is_array()) return refuse(fmt::format("\"{}\" is not a list", name));
    std::vector<std::string> strings;
    for (const Json& element : *found) {
        if (!element.is_string()) return refuse(fmt::format("\"{}\" is not a list of strings", name));
        strings.push_back(element.get<std::string>());
    }
    return strings;
}

std::optional<KsDate> RequestParams::date(const char* name) const {
    const auto text = string(name);
    if (!text) return std::nullopt;
    const auto date = KsDate::parseRFC3339(*text);
    if (!date) return refuse(fmt::format("\"{}\" is not a date of RFC 3339", name));
    return date;
}

std::optional<std::int64_t> RequestParams::integer(const char* name) const {
    const auto found = params_.find(name);
    if (found == params_.end()) return refuse(fmt::format("\"{}\" is missing", name));
    const bool fits = found->is_number_unsigned()
                          ? found->get<std::uint64_t>() <= std::numeric_limits<std::int64_t>::max()
                          : found->is_number_integer();
    if (!fits) return refuse(fmt::format("\"{}\" is not an integer of 64 bits", name));
    return found->get<std::int64_t>();
}

std::optional<Bytes> RequestParams::base64(const char* name) const {
    const auto text = string(name);
    if (!text) return std::nullopt;
    auto bytes = base64Decode(*text);
    if (!bytes) return refuse(fmt::format("\"{}\" is not base64", name));
    return bytes;
}

std::optional<KsURL> RequestParams::urlOrPath() const {
    if (has("url") == has("path")) return refuse("one of \"url\" and \"path\" is needed");
    return has("url") ? url() : path();
}

std::optional<TesselPage> RequestParams::page() const {
    if (has("page") && has("sort")) return refuse("\"sort\" is for the first page");
    if (has("page")) return base64("page");
    if (!has("sort")) return tesselInitialPageSortedByName();
    const auto sort = string("sort");
    if (!sort) return std::nullopt;
    if (*sort == "name") return tesselInitialPageSortedByName();
    if (*sort == "date") return tesselInitialPageSortedByDate();
    return refuse("\"sort\" is neither \"name\" nor \"date\"");
}

std::optional<KsURL> RequestParams::url() const {
    const auto text = string("url");
    if (!text) return std::nullopt;
    auto parsed = KsURL::parse(*text);
    if (!parsed) return refuse("\"url\" is not a URL of this machine");
    return parsed;
}

std::optional<KsURL> RequestParams::path() const {
    const auto text = string("path");
    if (!text) return std::nullopt;
    if (text->starts_with('/') && text->find('\0') == std::string::npos) return KsURL::fileURL(*text);
    return refuse("\"path\" is not an absolute path");
}

}  // namespace cindral
