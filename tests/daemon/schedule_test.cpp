// Which weekly schedule entry is in force, in a zone with daylight saving
// (Europe/Berlin: 2024-03-31 02:00 CET -> 03:00 CEST, 2024-10-27 03:00 CEST
// -> 02:00 CET), and the text forms the tool reads.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <time.h>

#include <string>
#include <vector>

#include "hostlib/db/guard_schedule.h"

namespace {

class ScheduleTest : public ::testing::Test {
protected:
    void SetUp() override {
        const char* tz = getenv("TZ");
        saved_ = tz ? tz : "";
        hadTz_ = tz != nullptr;
        setenv("TZ", "Europe/Berlin", 1);
        tzset();
    }
    void TearDown() override {
        if (hadTz_) {
            setenv("TZ", saved_.c_str(), 1);
        } else {
            unsetenv("TZ");
        }
        tzset();
    }
    std::string saved_;
    bool hadTz_ = false;
};

// "2024-10-27 02:10:00 +0100": a moment, the offset telling which of a
// repeated hour.
time_t At(const std::string& text) {
    struct tm tm = {};
    int offset = 0;
    EXPECT_EQ(sscanf(text.c_str(), "%d-%d-%d %d:%d:%d %d", &tm.tm_year, &tm.tm_mon, &tm.tm_mday,
                     &tm.tm_hour, &tm.tm_min, &tm.tm_sec, &offset),
              7)
        << text;
    tm.tm_year -= 1900;
    tm.tm_mon -= 1;
    return timegm(&tm) - (offset / 100 * 3600 + offset % 100 * 60);
}

GuardScheduleEntry Entry(int id, const char* days, const char* from, const char* to) {
    GuardScheduleEntry e;
    e.id = id;
    e.days = ParseScheduleDays(days);
    e.startSecond = ParseScheduleTime(from);
    e.endSecond = ParseScheduleTime(to);
    return e;
}

TEST_F(ScheduleTest, EntryInForceAcrossDaylightSavingAndMidnight) {
    const auto spring = {Entry(1, "all", "02:00", "03:00"), Entry(2, "all", "02:30", "04:00")};
    const auto autumn = {Entry(3, "all", "00:00", "02:30"), Entry(4, "all", "02:30", "06:00")};
    const auto endsInRepeat = {Entry(3, "all", "00:00", "02:30")};
    const auto night = {Entry(5, "fri,sat", "22:00", "06:00")};
    const auto overlap = {Entry(7, "all", "00:00", "00:00"), Entry(8, "all", "12:00", "13:00"),
                          Entry(6, "sat", "12:00", "14:00"), Entry(9, "fri", "22:00", "01:00")};
    struct Case {
        const char* what;
        std::vector<GuardScheduleEntry> entries;
        const char* at;
        int id;  // 0: none in force
        const char* since;
        const char* until;
    } cases[] = {
        // Spring forward: 02:00-02:59 never shows on the clock.
        {"skipped hour, before", spring, "2024-03-31 01:59:59 +0100", 0, "", ""},
        {"skipped hour: 02:00-03:00 is empty",
         {Entry(1, "all", "02:00", "03:00")},
         "2024-03-31 03:00:00 +0200",
         0,
         "",
         ""},
        {"the day before, no change", spring, "2024-03-30 02:45:00 +0100", 2,
         "2024-03-30 02:30:00 +0100", "2024-03-30 04:00:00 +0100"},
        {"a start in the gap falls at the change", spring, "2024-03-31 03:00:00 +0200", 2,
         "2024-03-31 03:00:00 +0200", "2024-03-31 04:00:00 +0200"},
        {"after the change", spring, "2024-03-31 03:59:59 +0200", 2, "2024-03-31 03:00:00 +0200",
         "2024-03-31 04:00:00 +0200"},
        // Fall back: 02:00-02:59 comes twice; the boundary at 02:30 happens once.
        {"repeated hour, first pass, before the boundary", autumn, "2024-10-27 02:29:59 +0200", 3,
         "2024-10-27 00:00:00 +0200", "2024-10-27 02:30:00 +0200"},
        {"repeated hour, first pass, at the boundary", autumn, "2024-10-27 02:30:00 +0200", 4,
         "2024-10-27 02:30:00 +0200", "2024-10-27 06:00:00 +0100"},
        {"repeated hour, second pass before 02:30", autumn, "2024-10-27 02:10:00 +0100", 4,
         "2024-10-27 02:30:00 +0200", "2024-10-27 06:00:00 +0100"},
        {"repeated hour, second pass after 02:30", autumn, "2024-10-27 02:45:00 +0100", 4,
         "2024-10-27 02:30:00 +0200", "2024-10-27 06:00:00 +0100"},
        {"an entry ended at the first 02:30 does not come back", endsInRepeat,
         "2024-10-27 02:10:00 +0100", 0, "", ""},
        // Across midnight: the weekday is the start's.
        {"Friday night", night, "2024-10-25 23:00:00 +0200", 5, "2024-10-25 22:00:00 +0200",
         "2024-10-26 06:00:00 +0200"},
        {"Saturday morning, from Friday", night, "2024-10-26 05:59:59 +0200", 5,
         "2024-10-25 22:00:00 +0200", "2024-10-26 06:00:00 +0200"},
        {"end is exclusive", night, "2024-10-26 06:00:00 +0200", 0, "", ""},
        {"Sunday night is not Friday's or Saturday's", night, "2024-10-27 23:00:00 +0100", 0, "",
         ""},
        {"a night across the fall-back lasts nine hours", night, "2024-10-27 05:00:00 +0100", 5,
         "2024-10-26 22:00:00 +0200", "2024-10-27 06:00:00 +0100"},
        {"Thursday night", night, "2024-10-24 23:00:00 +0200", 0, "", ""},
        // Overlaps: the latest start wins, ties to the lowest id.
        {"all day", overlap, "2024-10-23 11:00:00 +0200", 7, "2024-10-23 00:00:00 +0200",
         "2024-10-24 00:00:00 +0200"},
        {"a short entry inside takes over", overlap, "2024-10-23 12:30:00 +0200", 8,
         "2024-10-23 12:00:00 +0200", "2024-10-23 13:00:00 +0200"},
        {"and gives back at its end", overlap, "2024-10-23 13:00:00 +0200", 7,
         "2024-10-23 00:00:00 +0200", "2024-10-24 00:00:00 +0200"},
        {"equal starts: the lowest id", overlap, "2024-10-26 12:30:00 +0200", 6,
         "2024-10-26 12:00:00 +0200", "2024-10-26 14:00:00 +0200"},
        {"the longer one goes on", overlap, "2024-10-26 13:30:00 +0200", 6,
         "2024-10-26 12:00:00 +0200", "2024-10-26 14:00:00 +0200"},
        {"yesterday's night gives way to today's whole day", overlap, "2024-10-26 00:30:00 +0200",
         7, "2024-10-26 00:00:00 +0200", "2024-10-27 00:00:00 +0200"},
        {"the whole day of the fall-back has 25 hours", overlap, "2024-10-27 23:59:59 +0100", 7,
         "2024-10-27 00:00:00 +0200", "2024-10-28 00:00:00 +0100"},
        {"no weekday: never",
         {Entry(1, "", "00:00", "00:00")},
         "2024-10-23 11:00:00 +0200",
         0,
         "",
         ""},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(std::string(c.what) + " at " + c.at);
        const time_t at = At(c.at);
        const GuardScheduleInForce r = GuardScheduleAt(c.entries, at);
        ASSERT_EQ(r.entry ? r.entry->id : 0, c.id);
        // The same answer up to `next` (every entry here changes on a
        // quarter hour), another one there.
        const auto same = [&](const GuardScheduleInForce& o) {
            return o.entry == r.entry && o.since == r.since;
        };
        ASSERT_GT(r.next, at);
        for (time_t t = at; t < r.next; t += 900) ASSERT_TRUE(same(GuardScheduleAt(c.entries, t)));
        EXPECT_TRUE(same(GuardScheduleAt(c.entries, r.next - 1)));
        if (r.next < at + 8 * 86400) {
            EXPECT_FALSE(same(GuardScheduleAt(c.entries, r.next)));
        }
        if (c.id == 0) continue;
        EXPECT_EQ(r.since, At(c.since));
        EXPECT_EQ(r.until, At(c.until));
    }
}

TEST(ScheduleText, DaysTimesAndModes) {
    EXPECT_EQ(ParseScheduleDays("all"), 0x7f);
    EXPECT_EQ(ParseScheduleDays("mon-fri"), 0x1f);
    EXPECT_EQ(ParseScheduleDays("sat-mon,wed"), 0x1 | 0x4 | 0x20 | 0x40);
    EXPECT_EQ(ParseScheduleDays("Sun"), 0x40);
    for (const char* bad : {"", "mon,", "monday", "mon-", "mon,,tue"})
        EXPECT_EQ(ParseScheduleDays(bad), 0) << bad;
    EXPECT_EQ(ScheduleDaysText(0x1 | 0x40), "mon,sun");
    EXPECT_EQ(ScheduleDaysText(0x7f), "all");

    EXPECT_EQ(ParseScheduleTime("8:05"), 8 * 3600 + 5 * 60);
    EXPECT_EQ(ParseScheduleTime("23:59:59"), 86399);
    for (const char* bad :
         {"24:00", "12:60", "12:00:60", "12", "12:5", "12:00:", ":30", "1:2:3:4", "-1:00", "12:0x"})
        EXPECT_EQ(ParseScheduleTime(bad), -1) << bad;
    EXPECT_EQ(ScheduleTimeText(8 * 3600 + 5 * 60), "08:05");
    EXPECT_EQ(ScheduleTimeText(86399), "23:59:59");

    EXPECT_EQ(ParseScheduleMode("first"), 2);
    EXPECT_EQ(ParseScheduleMode("sometimes"), -1);
}

}  // namespace
