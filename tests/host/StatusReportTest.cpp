#include "host/StatusReport.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>

namespace cindral::test {
namespace {

using ::testing::HasSubstr;

class StatusReportTest : public ::testing::Test {
protected:
    StatusReportTest() {
        ::setenv("TZ", "UTC", 1);
        ::tzset();
    }
};

TEST_F(StatusReportTest, saysThatAllIsWell) {
    const StatusReport report = StatusReport::of(
        R"({"version":"1","storage":"/s","state":"/t","recorder":"inotify","recorderState":"following","coverage":"full","watches":{"used":3,"limit":9},)"
        R"("events":1,"objects":2,"documents":1,"oldestEventDate":"2026-11-20T10:00:00Z","search":{"exists":true,"items":1,"bytes":2000,"eventsBehind":0},)"
        R"("appLibraries":4,"errors":{"lastHour":0,"last":""},"problems":[]})");
    EXPECT_EQ(report.problems, 0U);
    EXPECT_EQ(report.text,
              "All is well.\n"
              "version   1\n"
              "storage   /s\n"
              "state     /t\n"
              "recorder  inotify, following, 3 of 9 watches\n"
              "coverage  full\n"
              "history   1 event kept, since 2026-11-20 10:00\n"
              "objects   2, 1 with identifiers of their own\n"
              "search    1 item, 2.0 kB, not behind\n"
              "libraries 4\n"
              "errors    none within the last hour\n");
}

TEST_F(StatusReportTest, putsWhatIsNotWellFirst) {
    const StatusReport report = StatusReport::of(
        R"({"problems":[{"what":"a","remedy":"b"},{"what":"c\n","remedy":"d"}],"coverage":[{"url":"u","how":"comparison","why":"w"}]})");
    EXPECT_EQ(report.problems, 2U);
    EXPECT_EQ(report.text, "Not well: a\n  To do: b\nNot well: c\\x0A\n  To do: d\ncoverage  comparison: u; w\n");
}

TEST_F(StatusReportTest, tellsOfErrorsAndOfTheIndexOnItsWay) {
    const StatusReport report = StatusReport::of(
        R"({"errors":{"lastHour":2,"last":"it broke"},"search":{"exists":true,"isGathering":true,"items":5,"bytes":0}})");
    EXPECT_THAT(report.text, HasSubstr("2 within the last hour, the last: it broke\n"));
    EXPECT_THAT(report.text, HasSubstr("5 items, 0 B, gathering\n"));
    EXPECT_THAT(StatusReport::of(R"({"search":{"exists":false}})").text, HasSubstr("none yet"));
    EXPECT_THAT(StatusReport::of(R"({"search":{"exists":true,"eventsBehind":1}})").text,
                HasSubstr("behind by 1 event\n"));
    EXPECT_THAT(StatusReport::of(R"({"search":{"exists":true}})").text, HasSubstr("it is gathered anew"));
}

TEST_F(StatusReportTest, takesAnythingElse) {
    for (const char* text :
         {"", "7", "[]", "{}", R"({"problems":7,"coverage":{},"search":3,"errors":null,"watches":[],"events":"x"})"})
        EXPECT_EQ(StatusReport::of(text).problems, 0U) << text;
}

TEST(DoctorReport, saysThatNothingWasWrong) {
    const DoctorReport report = DoctorReport::of(
        R"({"objects":7,"differences":0,"search":{"items":6,"wasDamaged":false,"missing":0,"outdated":0,"superfluous":0}})",
        {});
    EXPECT_EQ(report.problems, 0U);
    EXPECT_EQ(report.text,
              "Compared what is known of 7 objects with the files: it is the same.\n"
              "Compared the search index of 6 items with the files: it is whole.\n");
}

TEST(DoctorReport, saysWhatItDid) {
    const DoctorReport report = DoctorReport::of(
        R"({"objects":7,"differences":2,"search":{"items":1,"wasDamaged":true,"missing":1,"outdated":2,"superfluous":3},)"
        R"("repairs":["it was broken"],"problems":[{"what":"a","remedy":"b"}]})",
        {"/state/a\n"});
    EXPECT_EQ(report.problems, 1U);
    EXPECT_EQ(
        report.text,
        "Set aside what kept it from starting: /state/a\\x0A\n"
        "Found at the start: it was broken\n"
        "Compared what is known of 7 objects with the files: 2 differences were put right.\n"
        "The search index was damaged; it was made anew.\n"
        "Compared the search index of 1 item with the files: 1 missing, 2 out of date, 3 too many; it was put right.\n"
        "Not well: a\n  To do: b\n");
    EXPECT_THAT(report.json, HasSubstr(R"("setAside":["/state/a\n"])"));
}

TEST(DoctorReport, takesAnythingElse) {
    for (const char* text : {"", "7", "[]", "{}", R"({"repairs":7,"problems":{},"search":3})", R"({"repairs":[7]})"})
        EXPECT_EQ(DoctorReport::of(text, {"\xff"}).problems, 0U) << text;
}

}  // namespace
}  // namespace cindral::test
