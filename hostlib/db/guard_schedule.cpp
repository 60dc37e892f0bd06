// Weekly guard schedules: the entry in force (a pure function of the entries,
// the moment and the time zone), their text forms, and the table access.
#include "hostlib/db/guard_schedule.h"

#include <stdlib.h>
#include <strings.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>

#include "host/database.h"

namespace {

constexpr int64_t kDay = 86400;
const char* const kDayNames[7] = {"mon", "tue", "wed", "thu", "fri", "sat", "sun"};
const char* const kModeNames[5] = {"off", "continuous", "first", "second", "any"};

int64_t FloorDiv(int64_t a, int64_t b) { return a / b - ((a % b != 0) && ((a < 0) != (b < 0))); }

// The local wall clock's reading at `t`, as seconds since 1970-01-01 00:00 of
// that clock.
int64_t WallAt(int64_t t) {
    const time_t tt = static_cast<time_t>(t);
    struct tm tm;
    if (localtime_r(&tt, &tm) == nullptr) return t;
    return t + tm.tm_gmtoff;
}

// Monday 0 ... Sunday 6 of wall-clock day `day` (days since 1970-01-01, a Thursday).
int Weekday(int64_t day) { return static_cast<int>(((day + 3) % 7 + 7) % 7); }

// The first moment at which the wall clock reads `wall` or later. The UTC
// offsets in force within a day of it give the candidates; of those the clock
// reads exactly, the earliest (a time that comes twice counts the first
// time). When the clock skips the reading, the moment of the change, found
// between the candidates before and after it (the reading grows across it).
int64_t FirstAt(int64_t wall) {
    int64_t offsets[3];
    int n = 0;
    for (int64_t probe : {wall - kDay, wall, wall + kDay}) {
        const int64_t o = WallAt(probe) - probe;
        bool known = false;
        for (int i = 0; i < n; ++i) known = known || offsets[i] == o;
        if (!known) offsets[n++] = o;
    }
    int64_t lo = INT64_MAX, hi = INT64_MIN, best = INT64_MAX;
    for (int i = 0; i < n; ++i) {
        const int64_t t = wall - offsets[i];
        if (WallAt(t) == wall && t < best) best = t;
        if (t < lo) lo = t;
        if (t > hi) hi = t;
    }
    if (best != INT64_MAX) return best;
    if (WallAt(lo) >= wall || WallAt(hi) < wall) return wall - offsets[0];  // not seen in any zone
    while (hi - lo > 1) {
        const int64_t mid = lo + (hi - lo) / 2;
        (WallAt(mid) >= wall ? hi : lo) = mid;
    }
    return hi;
}

bool Usable(const GuardScheduleEntry& e) {
    return (e.days & kScheduleAllDays) != 0 && e.startSecond >= 0 && e.startSecond < kDay &&
           e.endSecond >= 0 && e.endSecond < kDay;
}

int Field(DBResult_tag* result, unsigned int row, const char* column) {
    const char* v = KELODBFetchField(result, row, column);
    return v ? atoi(v) : 0;
}

}  // namespace

bool GuardScheduleEntry::operator==(const GuardScheduleEntry& o) const {
    return id == o.id && camId == o.camId && days == o.days && startSecond == o.startSecond &&
           endSecond == o.endSecond && patrolId == o.patrolId && mode == o.mode &&
           repeatCount == o.repeatCount && pauseMinutes == o.pauseMinutes &&
           eventValidSeconds == o.eventValidSeconds;
}

GuardScheduleInForce GuardScheduleAt(const std::vector<GuardScheduleEntry>& entries, time_t now) {
    GuardScheduleInForce best;
    const int64_t at = now;
    const int64_t today = FloorDiv(WallAt(at), kDay);
    for (const GuardScheduleEntry& e : entries) {
        if (!Usable(e)) continue;
        // An occurrence in force now began today or yesterday (none lasts
        // longer than a day); today's, when it has begun, is the only candidate.
        for (int64_t day = today; day >= today - 1; --day) {
            if ((e.days & (1 << Weekday(day))) == 0) continue;
            const int64_t since = FirstAt(day * kDay + e.startSecond);
            if (since > at) continue;
            const int64_t endDay = e.endSecond > e.startSecond ? day : day + 1;
            const int64_t until = FirstAt(endDay * kDay + e.endSecond);
            if (at < until && (best.entry == nullptr || since > best.since ||
                               (since == best.since && e.id < best.entry->id))) {
                best.entry = &e;
                best.since = static_cast<time_t>(since);
                best.until = static_cast<time_t>(until);
            }
            break;
        }
    }
    // The next start of each entry after now: the first day from today with one.
    int64_t next = best.entry != nullptr ? static_cast<int64_t>(best.until) : at + 8 * kDay;
    for (const GuardScheduleEntry& e : entries) {
        if (!Usable(e)) continue;
        for (int64_t day = today; day <= today + 7; ++day) {
            if ((e.days & (1 << Weekday(day))) == 0) continue;
            const int64_t since = FirstAt(day * kDay + e.startSecond);
            if (since <= at) continue;
            next = std::min(next, since);
            break;
        }
    }
    best.next = static_cast<time_t>(next);
    return best;
}

int ParseScheduleDays(const std::string& text) {
    if (strcasecmp(text.c_str(), "all") == 0) return kScheduleAllDays;
    const auto day = [](const std::string& name) {
        for (int i = 0; i < 7; ++i)
            if (strcasecmp(name.c_str(), kDayNames[i]) == 0) return i;
        return -1;
    };
    int days = 0;
    size_t begin = 0;
    for (;;) {
        const size_t comma = text.find(',', begin);
        const std::string item = text.substr(begin, comma - begin);
        const size_t dash = item.find('-');
        const int first = day(item.substr(0, dash));
        const int last = dash == std::string::npos ? first : day(item.substr(dash + 1));
        if (first < 0 || last < 0) return 0;
        for (int d = first;; d = (d + 1) % 7) {  // "sat-mon" goes round the week's end
            days |= 1 << d;
            if (d == last) break;
        }
        if (comma == std::string::npos) return days;
        begin = comma + 1;
    }
}

std::string ScheduleDaysText(int days) {
    if ((days & kScheduleAllDays) == kScheduleAllDays) return "all";
    std::string text;
    for (int i = 0; i < 7; ++i) {
        if ((days & (1 << i)) == 0) continue;
        if (!text.empty()) text += ',';
        text += kDayNames[i];
    }
    return text;
}

int ParseScheduleTime(const std::string& text) {
    // Fields: hours of one or two digits, then minutes and seconds of two.
    int value[3] = {0, 0, 0}, fields = 0;
    size_t at = 0;
    for (; fields < 3; ++fields) {
        const size_t end = text.find(':', at);
        const std::string field = text.substr(at, end - at);
        if (field.empty() || field.size() > 2 || (fields > 0 && field.size() != 2) ||
            field.find_first_not_of("0123456789") != std::string::npos)
            return -1;
        value[fields] = atoi(field.c_str());
        if (end == std::string::npos) break;
        at = end + 1;
    }
    if (fields == 0 || fields == 3 || value[0] > 23 || value[1] > 59 || value[2] > 59) return -1;
    return value[0] * 3600 + value[1] * 60 + value[2];
}

std::string ScheduleTimeText(int second) {
    char text[16];
    if (second % 60 == 0) {
        snprintf(text, sizeof text, "%02d:%02d", second / 3600, second / 60 % 60);
    } else {
        snprintf(text, sizeof text, "%02d:%02d:%02d", second / 3600, second / 60 % 60, second % 60);
    }
    return text;
}

int ParseScheduleMode(const std::string& text) {
    for (int i = 0; i < 5; ++i)
        if (text == kModeNames[i]) return i;
    return -1;
}

const char* ScheduleModeText(int mode) { return mode >= 0 && mode < 5 ? kModeNames[mode] : "?"; }

int GuardScheduleLoad(int camId, std::vector<GuardScheduleEntry>* entries) {
    const std::string sql =
        "SELECT id, camId, days, extract(epoch FROM startTime)::int AS startSecond, "
        "extract(epoch FROM endTime)::int AS endSecond, patrolId, mode, repeatCount, "
        "pauseMinutes, eventValidSeconds FROM guard_schedule" +
        (camId != 0 ? " WHERE camId = " + itos(camId) : std::string()) + " ORDER BY camId, id;";
    DBResult_tag* result = nullptr;
    if (entries == nullptr || OvDBExecute(sql, &result) != 0) return -1;
    entries->clear();
    unsigned int row = 0;
    while (KELODBFetchRow(result, &row) == 0) {
        GuardScheduleEntry e;
        e.id = Field(result, row, "id");
        e.camId = Field(result, row, "camId");
        e.days = Field(result, row, "days");
        e.startSecond = Field(result, row, "startSecond");
        e.endSecond = Field(result, row, "endSecond");
        e.patrolId = Field(result, row, "patrolId");
        e.mode = Field(result, row, "mode");
        e.repeatCount = Field(result, row, "repeatCount");
        e.pauseMinutes = Field(result, row, "pauseMinutes");
        e.eventValidSeconds = Field(result, row, "eventValidSeconds");
        entries->push_back(e);
    }
    KELODBFreeResult(result);
    return 0;
}

int GuardScheduleAdd(GuardScheduleEntry* e) {
    if (e == nullptr) return -1;
    const auto time = [](int second) {
        char text[32];
        snprintf(text, sizeof text, "'%02d:%02d:%02d'", second / 3600, second / 60 % 60,
                 second % 60);
        return std::string(text);
    };
    const std::string sql =
        "INSERT INTO guard_schedule (camId, days, startTime, endTime, patrolId, mode, "
        "repeatCount, pauseMinutes, eventValidSeconds) VALUES (" +
        itos(e->camId) + ", " + itos(e->days) + ", " + time(e->startSecond) + ", " +
        time(e->endSecond) + ", " + itos(e->patrolId) + ", " + itos(e->mode) + ", " +
        itos(e->repeatCount) + ", " + itos(e->pauseMinutes) + ", " + itos(e->eventValidSeconds) +
        ") RETURNING id;";
    DBResult_tag* result = nullptr;
    if (OvDBExecute(sql, &result) != 0) return -1;
    e->id = KELODBNumRows(result) == 1 ? Field(result, 0, "id") : 0;
    KELODBFreeResult(result);
    return e->id > 0 ? 0 : -1;
}

int GuardScheduleRemove(int id, bool* removed) {
    DBResult_tag* result = nullptr;
    if (OvDBExecute("DELETE FROM guard_schedule WHERE id = " + itos(id) + " RETURNING id;",
                    &result) != 0)
        return -1;
    if (removed) *removed = KELODBNumRows(result) > 0;
    KELODBFreeResult(result);
    return 0;
}

int GuardScheduleFingerprint(std::string* fingerprint) {
    // Whole rows as text (quoted by the server), so no two contents give one text.
    static const char* const kSql =
        "SELECT md5(coalesce((SELECT string_agg(s::text, ';' ORDER BY s.id) FROM guard_schedule "
        "s), '') || '|' || coalesce((SELECT string_agg((c.id, c.host, c.port, c.username, "
        "c.password, c.vendor)::text, ';' ORDER BY c.id) FROM camera c WHERE c.id IN (SELECT "
        "camId FROM guard_schedule)), '') || '|' || coalesce((SELECT string_agg((p.id, "
        "p.camId)::text, ';' ORDER BY p.id) FROM patrol p WHERE p.id IN (SELECT patrolId FROM "
        "guard_schedule)), '')) AS fingerprint;";
    DBResult_tag* result = nullptr;
    if (fingerprint == nullptr || OvDBExecute(kSql, &result) != 0) return -1;
    const char* v = KELODBFetchField(result, 0, "fingerprint");
    *fingerprint = v ? v : "";
    KELODBFreeResult(result);
    return v ? 0 : -1;
}
