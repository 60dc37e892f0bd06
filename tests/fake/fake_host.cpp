#include "fake/fake_host.h"

#include <stdarg.h>
#include <syslog.h>

#include <algorithm>
#include <cstdio>
#include <thread>

#include "host/database.h"

namespace fake {
namespace {

struct Rule {
    std::string match;
    Answer answer;
    int times;
};

struct State {
    std::mutex mu;
    std::vector<Rule> rules;
    std::function<std::optional<Answer>(const std::string&)> handler;
    std::vector<std::string> statements;
    int resultsOutstanding = 0;
    int nullFrees = 0;

    std::map<int, FakeCamera> cameras;
    std::map<std::string, FakeCameraHost> hosts;
    std::vector<CameraCall> calls;
    std::vector<std::string> moves;
    int apisOutstanding = 0;
    std::function<void(int, const std::string&)> goPresetHook;
    std::function<void()> presetListHook;

    std::vector<LogLine> logs;
};

State& S() {
    static State* state = new State;  // never destroyed: worker threads may outlive main's statics
    return *state;
}

std::vector<std::function<void()>>& ResetHooks() {
    static auto* hooks = new std::vector<std::function<void()>>;
    return *hooks;
}

void Record(const std::string& what) {
    std::lock_guard<std::mutex> lock(S().mu);
    S().calls.push_back({what, std::chrono::steady_clock::now()});
}

Answer AnswerFor(const std::string& sql) {
    std::function<std::optional<Answer>(const std::string&)> handler;
    {
        std::lock_guard<std::mutex> lock(S().mu);
        S().statements.push_back(sql);
        handler = S().handler;
    }
    if (handler) {
        if (auto a = handler(sql)) return *a;
    }
    std::lock_guard<std::mutex> lock(S().mu);
    for (auto it = S().rules.begin(); it != S().rules.end(); ++it) {
        if (sql.find(it->match) == std::string::npos) continue;
        Answer a = it->answer;
        if (it->times > 0 && --it->times == 0) S().rules.erase(it);
        return a;
    }
    return Answer{};
}

class FakeApi : public CameraAPI {
public:
    explicit FakeApi(std::string host) : host_(std::move(host)) {}

    int SetReso(std::string reso) override {
        Record("SetReso " + reso);
        std::lock_guard<std::mutex> lock(S().mu);
        return S().hosts[host_].setResoRc;
    }
    int GetPresetList(std::map<int, std::string>& presets) override {
        Record("GetPresetList");
        std::function<void()> hook;
        {
            std::lock_guard<std::mutex> lock(S().mu);
            hook = S().presetListHook;
        }
        if (hook) hook();
        std::lock_guard<std::mutex> lock(S().mu);
        const FakeCameraHost& h = S().hosts[host_];
        if (h.presetListRc == 0) presets = h.presets;
        return h.presetListRc;
    }
    int GetSnapshotPath(std::string& path, int& port, int& type) override {
        Record("GetSnapshotPath");
        std::lock_guard<std::mutex> lock(S().mu);
        const FakeCameraHost& h = S().hosts[host_];
        if (h.snapshotPathRc != 0) return h.snapshotPathRc;
        path = h.snapshotPath;
        if (h.snapshotPort) port = *h.snapshotPort;
        type = h.snapshotType;
        return 0;
    }
    int GoPreset(int position, std::string name) override {
        Record("GoPreset " + std::to_string(position) + " " + name);
        std::function<void(int, const std::string&)> hook;
        {
            std::lock_guard<std::mutex> lock(S().mu);
            hook = S().goPresetHook;
        }
        if (hook) hook(position, name);
        std::lock_guard<std::mutex> lock(S().mu);
        S().moves.push_back(std::to_string(position) + " " + name);
        const auto& refused = S().hosts[host_].refusedPositions;
        return std::find(refused.begin(), refused.end(), position) == refused.end() ? 0 : -1;
    }

private:
    std::string host_;
};

}  // namespace

void OnSql(const std::string& match, Answer answer, int times) {
    std::lock_guard<std::mutex> lock(S().mu);
    S().rules.push_back({match, std::move(answer), times});
}

void OnSqlHandler(std::function<std::optional<Answer>(const std::string&)> handler) {
    std::lock_guard<std::mutex> lock(S().mu);
    S().handler = std::move(handler);
}

std::vector<std::string> Statements() {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().statements;
}

int ResultsOutstanding() {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().resultsOutstanding;
}

int NullResultsFreed() {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().nullFrees;
}

void AddCamera(const FakeCamera& camera) {
    std::lock_guard<std::mutex> lock(S().mu);
    S().cameras[camera.settings.id] = camera;
}

FakeCameraHost& CameraHost(const std::string& host) {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().hosts[host];  // std::map nodes are stable; configure before threads use it
}

std::vector<CameraCall> CameraCalls() {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().calls;
}

std::vector<std::string> CameraCallNames() {
    std::vector<std::string> names;
    for (const auto& c : CameraCalls()) names.push_back(c.what);
    return names;
}

std::vector<std::string> Moves() {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().moves;
}

int ApisOutstanding() {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().apisOutstanding;
}

void OnGoPreset(std::function<void(int, const std::string&)> hook) {
    std::lock_guard<std::mutex> lock(S().mu);
    S().goPresetHook = std::move(hook);
}

void OnGetPresetList(std::function<void()> hook) {
    std::lock_guard<std::mutex> lock(S().mu);
    S().presetListHook = std::move(hook);
}

std::vector<LogLine> Logs() {
    std::lock_guard<std::mutex> lock(S().mu);
    return S().logs;
}

std::vector<std::string> LogTexts() {
    std::vector<std::string> texts;
    for (const auto& l : Logs()) texts.push_back(l.text);
    return texts;
}

ResetHook::ResetHook(std::function<void()> hook) { ResetHooks().push_back(std::move(hook)); }

void Reset() {
    {
        std::lock_guard<std::mutex> lock(S().mu);
        State& s = S();
        s.rules.clear();
        s.handler = nullptr;
        s.statements.clear();
        s.resultsOutstanding = 0;
        s.nullFrees = 0;
        s.cameras.clear();
        s.hosts.clear();
        s.calls.clear();
        s.moves.clear();
        s.apisOutstanding = 0;
        s.goPresetHook = nullptr;
        s.presetListHook = nullptr;
        s.logs.clear();
    }
    for (auto& hook : ResetHooks()) hook();
}

bool WaitFor(const std::function<bool()>& condition, std::chrono::milliseconds timeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!condition()) {
        if (std::chrono::steady_clock::now() >= deadline) return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

}  // namespace fake

// ---- the host's database layer ----

struct DBResult_tag {
    std::vector<fake::Row> rows;
    unsigned int next = 0;
};

const char* gszTablePatrol = "patrol";
const char* gszTablePatrolPresetData = "patrol_preset";

int OvDBExecute(const std::string& sql, DBResult_tag** result) {
    fake::Answer a = fake::AnswerFor(sql);
    if (a.rc != 0) return a.rc;
    *result = new DBResult_tag{std::move(a.rows), 0};
    std::lock_guard<std::mutex> lock(fake::S().mu);
    ++fake::S().resultsOutstanding;
    return 0;
}

int OvDBExecute(const std::string& sql) { return fake::AnswerFor(sql).rc; }

std::string OvDBEscapeString(const std::string& text) {
    std::string out;
    for (char c : text) {
        if (c == '\'') out += '\'';
        out += c;
    }
    return out;
}

std::string itos(long long value) { return std::to_string(value); }

extern "C" {

int KELODBNumRows(DBResult_tag* result) {
    return result ? static_cast<int>(result->rows.size()) : 0;
}

int KELODBFetchRow(DBResult_tag* result, unsigned int* row) {
    if (!result || !row || result->next >= result->rows.size()) return -1;
    *row = result->next++;
    return 0;
}

const char* KELODBFetchField(DBResult_tag* result, unsigned int row, const char* column) {
    if (!result || row >= result->rows.size() || !column) return nullptr;
    const auto& r = result->rows[row];
    auto it = r.find(column);
    if (it == r.end() || !it->second) return nullptr;
    return it->second->c_str();
}

void KELODBFreeResult(DBResult_tag* result) {
    std::lock_guard<std::mutex> lock(fake::S().mu);
    if (!result) {
        ++fake::S().nullFrees;
        return;
    }
    --fake::S().resultsOutstanding;
    delete result;
}

// ---- syslog, interposed ----

static void CaptureLog(int priority, const char* format, va_list args) {
    char buf[4096];
    vsnprintf(buf, sizeof buf, format, args);
    std::lock_guard<std::mutex> lock(fake::S().mu);
    fake::S().logs.push_back({priority, buf});
}

void syslog(int priority, const char* format, ...) {
    va_list args;
    va_start(args, format);
    CaptureLog(priority, format, args);
    va_end(args);
}

void __syslog_chk(int priority, int, const char* format, ...) {
    va_list args;
    va_start(args, format);
    CaptureLog(priority, format, args);
    va_end(args);
}

}  // extern "C"

// ---- the host's camera layer ----

int Camera::Load(int id, int) {
    fake::Record("Camera::Load " + std::to_string(id));
    std::lock_guard<std::mutex> lock(fake::S().mu);
    auto it = fake::S().cameras.find(id);
    if (it == fake::S().cameras.end() || it->second.loadFails) return -1;
    settings_ = it->second.settings;
    return 0;
}

int GetCamConnStatus(int camId) {
    fake::Record("GetCamConnStatus " + std::to_string(camId));
    std::lock_guard<std::mutex> lock(fake::S().mu);
    auto it = fake::S().cameras.find(camId);
    return it == fake::S().cameras.end() ? 1 : it->second.connStatus;
}

CameraAPI* newCameraAPI(const std::string& host, int port, const std::string& username,
                        const std::string& password, const std::string& vendor,
                        const std::string& model, const std::string& channel) {
    fake::Record("newCameraAPI " + host + " " + std::to_string(port) + " " + username + " " +
                 password + " " + vendor + " " + model + " " + channel);
    std::lock_guard<std::mutex> lock(fake::S().mu);
    if (fake::S().hosts[host].apiNull) return nullptr;
    ++fake::S().apisOutstanding;
    return new fake::FakeApi(host);
}

CameraAPI* newUserDefinedAPI(const std::string& host, int port, const std::string& username,
                             const std::string& password, const std::string& path,
                             const std::string& type) {
    fake::Record("newUserDefinedAPI " + host + " " + std::to_string(port) + " " + username + " " +
                 password + " " + path + " " + type);
    std::lock_guard<std::mutex> lock(fake::S().mu);
    if (fake::S().hosts[host].userApiNull) return nullptr;
    ++fake::S().apisOutstanding;
    return new fake::FakeApi(host);
}

void releaseCameraAPI(CameraAPI* api) {
    fake::Record("releaseCameraAPI");
    {
        std::lock_guard<std::mutex> lock(fake::S().mu);
        --fake::S().apisOutstanding;
    }
    delete api;
}
