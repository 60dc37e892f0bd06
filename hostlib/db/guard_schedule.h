// Weekly guard schedules: entries per camera in the guard_schedule table, and
// which entry is in force at a given moment.
//
// An entry is in force on its weekdays from its start time of day to its end
// time of day, as the local wall clock of this process (TZ, else
// /etc/localtime) reads them:
//   - the end is exclusive; an end at or before the start means the next day
//     (22:00-06:00 runs through midnight, 22:00-00:00 to midnight), and an
//     end equal to the start makes a whole day (00:00-00:00: all day);
//   - the weekday is that of the start: a Friday 22:00-06:00 entry ends on
//     Saturday morning;
//   - a start or end is the first moment the wall clock reads that time or
//     later that day. On the spring-forward day a time the clock skips
//     (02:30 in a 02:00 -> 03:00 change) falls at the change, so a
//     02:00-03:00 entry is not in force that day and 02:30-04:00 runs from
//     03:00; on the fall-back day a time that comes twice counts the first
//     time only, so a boundary at 02:30 happens once, and an entry never
//     ends and starts again within the repeated hour.
// Overlapping entries: the one whose present occurrence started most
// recently is in force (so a short entry inside an all-day one takes over
// while it lasts); equal starts go to the lowest id. An entry in mode OFF
// takes part like any other: it stops guarding while it is in force.
#ifndef HOSTLIB_DB_GUARD_SCHEDULE_H
#define HOSTLIB_DB_GUARD_SCHEDULE_H

#include <time.h>

#include <string>
#include <vector>

// Weekday bits of GuardScheduleEntry::days.
enum { kScheduleMonday = 1, kScheduleSunday = 1 << 6, kScheduleAllDays = 0x7f };

struct GuardScheduleEntry {
    int id = 0;
    int camId = 0;
    int days = kScheduleAllDays;  // bit 0 Monday ... bit 6 Sunday
    int startSecond = 0;          // time of day, seconds after midnight (0 to 86399)
    int endSecond = 0;            // exclusive; at or before startSecond: the next day
    int patrolId = 0;
    int mode = 0;  // GUARD_MODE_* (executor/guardExecutor.h)
    int repeatCount = 1;
    int pauseMinutes = 1;
    int eventValidSeconds = 10;

    bool operator==(const GuardScheduleEntry& o) const;
    bool operator!=(const GuardScheduleEntry& o) const { return !(*this == o); }
};

struct GuardScheduleInForce {
    const GuardScheduleEntry* entry = nullptr;  // into the entries given; null: none in force
    time_t since = 0;                           // when its present occurrence began
    time_t until = 0;                           // when that occurrence ends
    // The next moment the answer may change: the end of that occurrence or
    // the next start of any entry, whichever is first; at most 8 days ahead.
    // Until then (and while the entries, the zone and the clock's course
    // stay) the answer is the same.
    time_t next = 0;
};

// The entry of `entries` in force at `now` in the process's time zone. A pure
// function of its arguments and the zone's rules; entries with no weekday or
// with times outside the day are never in force. Thread-safe.
GuardScheduleInForce GuardScheduleAt(const std::vector<GuardScheduleEntry>& entries, time_t now);

// Text forms, as the tool and the service show them and the tool reads them.
// Days: "mon,tue,sat", "mon-fri", "all"; ParseScheduleDays gives 0 for text it
// does not read (and for no day).
int ParseScheduleDays(const std::string& text);
std::string ScheduleDaysText(int days);
// Time of day: "HH:MM" or "HH:MM:SS", 00:00 to 23:59:59; -1 otherwise.
int ParseScheduleTime(const std::string& text);
std::string ScheduleTimeText(int second);  // "HH:MM", or "HH:MM:SS" when the seconds are not 0
// Modes: "off", "continuous", "first", "second", "any"; -1 for other text.
int ParseScheduleMode(const std::string& text);
const char* ScheduleModeText(int mode);  // "?" for an unknown value

// The guard_schedule table (hostlib/db/schema.sql), through the database
// layer (host/database.h). Each is one statement; 0: done, -1: it failed.
//
// The entries of camera `camId` (all cameras when 0), ordered by camera and id.
int GuardScheduleLoad(int camId, std::vector<GuardScheduleEntry>* entries);
// Adds an entry; its new id goes into entry->id.
int GuardScheduleAdd(GuardScheduleEntry* entry);
// Removes entry `id`; *removed tells whether there was one.
int GuardScheduleRemove(int id, bool* removed);
// A digest of every entry and of what the service reads with them (the
// camera records of scheduled cameras, the camera of each scheduled patrol):
// it changes whenever one of them does. One short row, for cheap polling.
int GuardScheduleFingerprint(std::string* fingerprint);

#endif  // HOSTLIB_DB_GUARD_SCHEDULE_H
