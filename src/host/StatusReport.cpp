#include "host/StatusReport.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <nlohmann/json.hpp>

#include "host/TerminalText.h"
#include "platform/foundation/KsDate.h"

namespace cindral {
namespace {

using OrderedJson = nlohmann::ordered_json;

/// Fields of the status, absent ones as nothing.
class StatusFields {
public:
    explicit StatusFields(const OrderedJson& json) : json_(json) {}

    bool has(const char* name) const { return json_.is_object() && json_.contains(name); }
    StatusFields operator[](const char* name) const { return StatusFields(has(name) ? json_[name] : none()); }
    std::string text(const char* name) const {
        return has(name) && json_[name].is_string() ? terminalText(json_[name].get<std::string>()) : "";
    }
    std::uint64_t number(const char* name) const {
        return has(name) && json_[name].is_number_unsigned() ? json_[name].get<std::uint64_t>() : 0;
    }
    bool flag(const char* name) const { return has(name) && json_[name].is_boolean() && json_[name].get<bool>(); }
    const OrderedJson& list(const char* name) const {
        return has(name) && json_[name].is_array() ? json_[name] : none();
    }

private:
    static const OrderedJson& none() {
        static const OrderedJson empty = OrderedJson::array();
        return empty;
    }
    const OrderedJson& json_;
};

std::string momentOf(const std::string& text) {
    const auto date = KsDate::parseRFC3339(text);
    return date ? humanMinute(*date) : text;
}

std::string recorderText(const StatusFields& fields) {
    std::string text = fields.text("recorder");
    if (const std::string state = fields.text("recorderState"); !state.empty()) text += ", " + state;
    const StatusFields watches = fields["watches"];
    if (watches.number("limit") > 0) {
        text += fmt::format(", {} of {} watches", watches.number("used"), watches.number("limit"));
    } else if (watches.has("used")) {
        text += ", " + counted(watches.number("used"), "watch", "watches");
    }
    return text;
}

std::string searchText(const StatusFields& search) {
    if (!search.flag("exists")) return "none yet; the first question makes it";
    std::string text = counted(search.number("items"), "item", "items") + ", " + humanSize(search.number("bytes"));
    if (search.flag("isGathering")) return text + ", gathering";
    if (!search.has("eventsBehind")) return text + ", behind by all there is: it is gathered anew";
    const std::uint64_t behind = search.number("eventsBehind");
    return text + (behind == 0 ? ", not behind" : ", behind by " + counted(behind, "event", "events"));
}

/// A line each, the heaviest thing first.
std::string problemLines(const OrderedJson& problems) {
    std::string lines;
    for (const OrderedJson& each : problems) {
        const StatusFields problem(each);
        lines += fmt::format("Not well: {}\n  To do: {}\n", problem.text("what"), problem.text("remedy"));
    }
    return lines;
}

std::string errorsText(const StatusFields& errors) {
    if (errors.number("lastHour") == 0) return "none within the last hour";
    return fmt::format("{} within the last hour, the last: {}", errors.number("lastHour"), errors.text("last"));
}

}  // namespace

StatusReport StatusReport::of(const std::string& json) {
    const OrderedJson parsed = OrderedJson::parse(json, nullptr, /*allow_exceptions=*/false);
    const StatusFields fields(parsed);
    StatusReport report;
    const OrderedJson& problems = fields.list("problems");
    report.problems = problems.size();
    if (problems.empty()) report.text += "All is well.\n";
    report.text += problemLines(problems);
    const auto line = [&](const char* field, std::string_view name, const std::string& text) {
        if (fields.has(field)) report.text += fmt::format("{:<10}{}\n", name, text);
    };
    line("version", "version", fields.text("version"));
    line("storage", "storage", fields.text("storage"));
    line("state", "state", fields.text("state"));
    line("recorder", "recorder", recorderText(fields));
    if (fields.has("coverage") && fields.list("coverage").empty())
        line("coverage", "coverage", fields.text("coverage"));
    for (const OrderedJson& each : fields.list("coverage")) {
        const StatusFields part(each);
        line("coverage", "coverage", fmt::format("{}: {}; {}", part.text("how"), part.text("url"), part.text("why")));
    }
    std::string events = counted(fields.number("events"), "event", "events") + " kept";
    if (fields.has("oldestEventDate")) events += ", since " + momentOf(fields.text("oldestEventDate"));
    line("events", "history", events);
    line("objects", "objects",
         fmt::format("{}, {} with identifiers of their own", fields.number("objects"), fields.number("documents")));
    line("search", "search", searchText(fields["search"]));
    line("appLibraries", "libraries", fmt::to_string(fields.number("appLibraries")));
    line("errors", "errors", errorsText(fields["errors"]));
    return report;
}

DoctorReport DoctorReport::of(const std::string& json, const std::vector<std::string>& setAside) {
    OrderedJson parsed = OrderedJson::parse(json, nullptr, /*allow_exceptions=*/false);
    if (!parsed.is_object()) parsed = OrderedJson::object();
    parsed["setAside"] = setAside;
    const StatusFields fields(parsed);
    DoctorReport report;
    report.json = parsed.dump(-1, ' ', false, OrderedJson::error_handler_t::replace);
    const auto line = [&](const std::string& text) { report.text += text + "\n"; };
    for (const std::string& path : setAside) line("Set aside what kept it from starting: " + terminalText(path));
    for (const OrderedJson& repair : fields.list("repairs")) {
        if (repair.is_string()) line("Found at the start: " + terminalText(repair.get<std::string>()));
    }
    const std::string objects = counted(fields.number("objects"), "object", "objects");
    const std::uint64_t differences = fields.number("differences");
    line(fmt::format("Compared what is known of {} with the files: {}.", objects,
                     differences == 0 ? "it is the same"
                                      : counted(differences, "difference was", "differences were") + " put right"));
    const StatusFields search = fields["search"];
    const std::string items = counted(search.number("items"), "item", "items");
    std::vector<std::string> found;
    const auto note = [&](const char* field, std::string_view what) {
        if (const std::uint64_t count = search.number(field); count > 0)
            found.push_back(fmt::format("{} {}", count, what));
    };
    note("missing", "missing");
    note("outdated", "out of date");
    note("superfluous", "too many");
    if (search.flag("wasDamaged")) line("The search index was damaged; it was made anew.");
    line(found.empty() ? fmt::format("Compared the search index of {} with the files: it is whole.", items)
                       : fmt::format("Compared the search index of {} with the files: {}; it was put right.", items,
                                     fmt::join(found, ", ")));
    const OrderedJson& problems = fields.list("problems");
    report.problems = problems.size();
    report.text += problemLines(problems);
    return report;
}

}  // namespace cindral
