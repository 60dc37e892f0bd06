// ptzpatrol schedule add|list|remove (the weekly guard schedules that
// ptzpatrold follows) and ptzpatrol status (what ptzpatrold is doing).
#include <curl/curl.h>

#include <algorithm>
#include <cstdlib>

#include "commands.h"
#include "executor/guardExecutor.h"
#include "hostlib/db/guard_schedule.h"
#include "hostlib/http/curl_global.h"

namespace ptztool {
namespace {

using nlohmann::json;

void RequireScheduleTable() {
    const auto rows =
        Query("SELECT (to_regclass('guard_schedule') IS NOT NULL)::int AS ok;", {"ok"});
    if (rows.empty() || rows[0][0] != "1")
        throw Error{kNoTables, "the database has no guard_schedule table: run 'ptzpatrol init-db'"};
}

json EntryJson(const GuardScheduleEntry& e) {
    return {{"id", e.id},
            {"camera", e.camId},
            {"days", ScheduleDaysText(e.days)},
            {"from", ScheduleTimeText(e.startSecond)},
            {"to", ScheduleTimeText(e.endSecond)},
            {"patrol", e.patrolId},
            {"mode", ScheduleModeText(e.mode)},
            {"repeat", e.repeatCount},
            {"pause", e.pauseMinutes},
            {"eventValid", e.eventValidSeconds}};
}

std::string EntryText(const GuardScheduleEntry& e) {
    return ScheduleDaysText(e.days) + " " + ScheduleTimeText(e.startSecond) + "-" +
           ScheduleTimeText(e.endSecond) + ", patrol " + std::to_string(e.patrolId) + ", mode " +
           ScheduleModeText(e.mode) + ", repeat " + std::to_string(e.repeatCount) + ", pause " +
           std::to_string(e.pauseMinutes) + " min, events valid " +
           std::to_string(e.eventValidSeconds) + " s";
}

size_t Collect(char* data, size_t size, size_t count, void* into) {
    static_cast<std::string*>(into)->append(data, size * count);
    return size * count;
}

// "HH:MM:SS" of an ISO time the service gives ("2024-10-27T02:30:00+02:00").
std::string Clock(const json& iso) {
    return iso.is_string() && iso.get<std::string>().size() >= 19
               ? iso.get<std::string>().substr(11, 8)
               : "-";
}

std::string EventText(const json& events, const char* which) {
    if (events.value("source", "") != "onvif") return "-";
    const json& e = events[which];
    if (!events.value("subscribed", false)) return "absent";
    if (!e.value("known", false)) return "?";
    std::string text = e.value("state", false) ? "on" : "off";
    if (e["lastChange"].is_string()) text += " " + Clock(e["lastChange"]);
    if (e.value("present", false) && !e.value("state", false)) text += " (valid)";
    return text;
}

}  // namespace

int DeleteScheduleEntries(const std::string& where) {
    if (Query("SELECT (to_regclass('guard_schedule') IS NOT NULL)::int AS ok;", {"ok"})[0][0] !=
        "1")
        return 0;  // a database from before schedules
    return static_cast<int>(
        Query("DELETE FROM guard_schedule WHERE " + where + " RETURNING id;", {"id"}).size());
}

int ScheduleAdd(const ScheduleAddOptions& o) {
    GuardScheduleEntry e;
    e.camId = o.camId;
    e.patrolId = o.patrolId;
    e.mode = ParseScheduleMode(o.mode);
    e.days = ParseScheduleDays(o.days);
    e.startSecond = ParseScheduleTime(o.from);
    e.endSecond = ParseScheduleTime(o.to);
    e.repeatCount = o.repeat;
    e.pauseMinutes = o.pauseMinutes;
    e.eventValidSeconds = o.eventValidSeconds;
    if (e.mode < 0) throw Error{kUsage, "--mode must be continuous, first, second, any or off"};
    if (e.days == 0)
        throw Error{kUsage, "--days must be days as mon,tue,... or ranges as mon-fri, or all"};
    if (e.startSecond < 0) throw Error{kUsage, "--from must be HH:MM or HH:MM:SS"};
    if (e.endSecond < 0) throw Error{kUsage, "--to must be HH:MM or HH:MM:SS"};
    if (o.repeat < 0) throw Error{kUsage, "--repeat must be 0 (without end) or more"};
    if (o.pauseMinutes < 0 || o.pauseMinutes > 35)
        throw Error{kUsage, "--pause must be 0 to 35 minutes"};
    if (o.eventValidSeconds < 0 || o.eventValidSeconds > 2147)
        throw Error{kUsage, "--event-valid must be 0 to 2147 seconds"};
    RequireDatabase(true);
    RequireScheduleTable();
    LoadCamera(o.camId);
    const auto owner =
        Query("SELECT camId FROM patrol WHERE id = " + itos(o.patrolId) + ";", {"camId"});
    if (owner.empty()) throw Error{kUnknownId, "no patrol " + std::to_string(o.patrolId)};
    if (atoi(owner[0][0].c_str()) != o.camId)
        throw Error{kUnknownId, "patrol " + std::to_string(o.patrolId) + " is of camera " +
                                    owner[0][0] + ", not camera " + std::to_string(o.camId)};
    if (GuardScheduleAdd(&e) != 0) throw Error{kDbError, "adding the schedule entry failed"};
    json j = EntryJson(e);
    j["event"] = "schedule-added";
    Out::Emit("schedule entry " + std::to_string(e.id) + " of camera " + std::to_string(e.camId) +
                  " added: " + EntryText(e),
              j);
    return kOk;
}

int ScheduleList(int camId) {
    RequireDatabase(true);
    RequireScheduleTable();
    LoadCamera(camId);
    std::vector<GuardScheduleEntry> entries;
    if (GuardScheduleLoad(camId, &entries) != 0)
        throw Error{kDbError, "reading the schedule failed"};
    const GuardScheduleInForce now = GuardScheduleAt(entries, time(nullptr));
    if (entries.empty() && !Out::Json())
        Out::Emit("camera " + std::to_string(camId) + " has no schedule entries", {});
    for (const GuardScheduleEntry& e : entries) {
        const bool inForce = now.entry == &e;
        json j = EntryJson(e);
        j["inForce"] = inForce;
        Out::Emit(std::to_string(e.id) + "\t" + EntryText(e) + (inForce ? "\t(in force)" : ""), j);
    }
    return kOk;
}

int ScheduleRemove(int id) {
    RequireDatabase(true);
    RequireScheduleTable();
    bool removed = false;
    if (GuardScheduleRemove(id, &removed) != 0)
        throw Error{kDbError, "removing schedule entry " + std::to_string(id) + " failed"};
    if (!removed) throw Error{kUnknownId, "no schedule entry " + std::to_string(id)};
    Out::Emit("schedule entry " + std::to_string(id) + " removed",
              {{"event", "schedule-removed"}, {"id", id}});
    return kOk;
}

int Status(const std::string& daemon) {
    const size_t colon = daemon.rfind(':');
    if (colon == std::string::npos || colon == 0 || colon + 1 == daemon.size() ||
        daemon.find_first_not_of("0123456789", colon + 1) != std::string::npos)
        throw Error{kUsage, "--daemon must be HOST:PORT, not '" + daemon + "'"};
    HostCurlGlobalInit();
    CURL* curl = curl_easy_init();
    if (curl == nullptr) throw Error{kUnavailable, "cannot make an HTTP request"};
    std::string body;
    const std::string url = "http://" + daemon + "/status";
    curl_easy_setopt(curl, CURLOPT_URL, url.c_str());
    curl_easy_setopt(curl, CURLOPT_WRITEFUNCTION, Collect);
    curl_easy_setopt(curl, CURLOPT_WRITEDATA, &body);
    curl_easy_setopt(curl, CURLOPT_TIMEOUT_MS, 5000L);
    curl_easy_setopt(curl, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(curl, CURLOPT_NOPROXY, "*");
    const CURLcode rc = curl_easy_perform(curl);
    long http = 0;
    curl_easy_getinfo(curl, CURLINFO_RESPONSE_CODE, &http);
    curl_easy_cleanup(curl);
    if (rc != CURLE_OK)
        throw Error{kUnavailable,
                    "cannot reach ptzpatrold at " + daemon + ": " + curl_easy_strerror(rc)};
    const json status = json::parse(body, nullptr, false);
    if (http != 200 || !status.is_object() || !status["cameras"].is_array())
        throw Error{kProtocol, "ptzpatrold at " + daemon + " answered HTTP " +
                                   std::to_string(http) + " without its status"};
    if (Out::Json()) {
        Out::Emit("", status);
        return kOk;
    }
    const json& schedule = status["schedule"];
    Out::Emit("ptzpatrold at " + daemon + ": " + std::to_string(status["cameras"].size()) +
                  " camera(s), tables read " + Clock(schedule["readAt"]),
              {});
    if (schedule["error"].is_string())
        Out::Emit("schedule: " + schedule["error"].get<std::string>(), {});
    for (const json& p : schedule["problems"]) Out::Emit("left out: " + p.get<std::string>(), {});

    std::vector<std::vector<std::string>> rows = {
        {"camera", "entry", "guard", "run", "first", "second", "last error"}};
    for (const json& c : status["cameras"]) {
        const json& e = c["entry"];
        const json& run = c["run"];
        rows.push_back(
            {std::to_string(c.value("camera", 0)),
             e.is_object()
                 ? std::to_string(e.value("id", 0)) + " " + e.value("mode", "") + " patrol " +
                       std::to_string(e.value("patrol", 0)) + " until " + Clock(e["until"])
                 : "-",
             c.value("guard", "?"),
             run.value("running", false)
                 ? run.value("type", "") + " patrol " + std::to_string(run.value("patrol", 0)) +
                       (run.value("index", -1) < 0
                            ? " starting"
                            : " preset " + std::to_string(run.value("index", 0) + 1) + "/" +
                                  std::to_string(run.value("count", 0)) + " position " +
                                  std::to_string(run.value("position", 0)))
                 : "-",
             EventText(c["events"], "first"), EventText(c["events"], "second"),
             c["lastError"].is_string() ? c["lastError"].get<std::string>() : "-"});
    }
    std::vector<size_t> width(rows[0].size(), 0);
    for (const auto& r : rows)
        for (size_t i = 0; i < r.size(); ++i) width[i] = std::max(width[i], r[i].size());
    for (const auto& r : rows) {
        std::string line;
        for (size_t i = 0; i < r.size(); ++i)
            line += i + 1 < r.size() ? r[i] + std::string(width[i] + 2 - r[i].size(), ' ') : r[i];
        Out::Emit(line, {});
    }
    return kOk;
}

}  // namespace ptztool
