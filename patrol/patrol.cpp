// Patrol record, its storage, preset storage, preset synchronisation with the
// camera, and the patrol listings.
#include "patrol/patrol.h"

#include <stdlib.h>
#include <syslog.h>

#include <cstdio>
#include <map>
#include <memory>
#include <new>

#include "common/camera_control.h"
#include "host/camera.h"

#define PATROL_LOG(fmt, ...) \
    syslog(LOG_ERR, "%s:%d:%s(): " fmt, "patrol.cpp", __LINE__, __func__, ##__VA_ARGS__)

namespace {

constexpr size_t kStatementSize = 16384;
constexpr size_t kNameLimit = 256;

// Numeric field: base-10 strtol semantics, a null field gives 0.
int FieldToInt(const char* text) {
    return text ? static_cast<int>(strtol(text, nullptr, 10)) : 0;
}

// Text field: a null field (SQL NULL, missing column) reads as empty.
std::string FieldToText(const char* text) { return text ? std::string(text) : std::string(); }

// Length of the first `limit` bytes of `text`, moved back so that the cut does
// not split a UTF-8 sequence that begins at or before the limit and is valid.
size_t Utf8SafeCut(const std::string& text, size_t limit) {
    if (text.size() <= limit) return text.size();
    const auto byte = [&](size_t i) { return static_cast<unsigned char>(text[i]); };
    if ((byte(limit) & 0xC0) != 0x80) return limit;  // the next byte starts a character
    // Find the lead byte of the sequence that byte `limit` continues.
    size_t lead = limit;
    while (lead > 0 && limit - lead < 3 && (byte(lead - 1) & 0xC0) == 0x80) --lead;
    if (lead == 0) return limit;
    --lead;
    const unsigned char b = byte(lead);
    size_t len = 0;
    if (b >= 0xC2 && b <= 0xDF) len = 2;
    else if (b >= 0xE0 && b <= 0xEF) len = 3;
    else if (b >= 0xF0 && b <= 0xF4) len = 4;
    if (len == 0 || lead + len <= limit) return limit;  // not a lead byte, or sequence ends before
    if (lead + len > text.size()) return limit;         // truncated sequence: not valid UTF-8
    for (size_t i = lead + 1; i < lead + len; ++i) {
        if ((byte(i) & 0xC0) != 0x80) return limit;
    }
    // Reject overlong, surrogate and out-of-range forms as the decoder would.
    const unsigned char b1 = byte(lead + 1);
    if ((b == 0xE0 && b1 < 0xA0) || (b == 0xED && b1 > 0x9F) || (b == 0xF0 && b1 < 0x90) ||
        (b == 0xF4 && b1 > 0x8F)) {
        return limit;
    }
    return lead;
}

struct FreeDeleter {
    void operator()(char* p) const { free(p); }
};
using StatementBuffer = std::unique_ptr<char, FreeDeleter>;

StatementBuffer NewStatementBuffer() {
    return StatementBuffer(static_cast<char*>(malloc(kStatementSize)));
}

// Formats into the statement buffer. False when the text does not fit: a
// statement cut short must never be executed.
template <typename... Args>
bool FormatStatement(char* buffer, const char* format, Args... args) {
    const int n = snprintf(buffer, kStatementSize, format, args...);
    return n >= 0 && static_cast<size_t>(n) < kStatementSize;
}

// Statement that takes the patrol row's lock at the head of a preset rewrite,
// so that two rewrites of one patrol run one after the other: the second
// deletes what the first wrote instead of leaving both lists behind.
std::string PatrolLockStatement(int id) {
    return std::string("SELECT id FROM ") + gszTablePatrol + " WHERE id = " + itos(id) + " FOR UPDATE;";
}

std::string PresetDeleteStatement(int id) {
    return std::string("DELETE FROM ") + gszTablePatrolPresetData + " WHERE " + "patrolId" + " = " +
           itos(id) + ";";
}

// Appends to `batch` one insert per preset, each on a line of its own,
// formatted in `buffer`. Every statement is formed before anything runs, so a
// batch is all-or-nothing. -1 when all fit; else the index of the first
// preset whose insert does not fit the statement buffer.
int AppendPresetInserts(std::string& batch, char* buffer, int camId, int id,
                        const std::vector<PRESET_INFO>& presets) {
    for (size_t i = 0; i < presets.size(); ++i) {
        const std::string escaped = OvDBEscapeString(presets[i].name);
        const int sequence = static_cast<int>(i);
        if (!FormatStatement(buffer,
                             "INSERT INTO %s (id, camId, patrolId, position, name, sequence ) VALUES "
                             "(DEFAULT, %d, %d, %d, '%s', %d);",
                             gszTablePatrolPresetData, camId, id, presets[i].position, escaped.c_str(),
                             sequence)) {
            return sequence;
        }
        batch += '\n';
        batch += buffer;
    }
    return -1;
}

// Releases a result on every way out.
struct ResultHolder {
    DBResult_tag* result = nullptr;
    ~ResultHolder() { KELODBFreeResult(result); }
    ResultHolder() = default;
    ResultHolder(const ResultHolder&) = delete;
    ResultHolder& operator=(const ResultHolder&) = delete;
};

}  // namespace

// ---- record and preset list ----

Patrol::Patrol() : id(0), camId(0), name(), stayTime(0), presetList() {}

Patrol::Patrol(int camId, std::string name, unsigned int stayTime)
    : id(0), camId(camId), name(std::move(name)), stayTime(static_cast<int>(stayTime)), presetList() {}

Patrol::Patrol(int id) : id(0), camId(0), name(), stayTime(0), presetList() {
    if (id >= 1) Load(id);
}

void Patrol::SetCamId(int camId) { this->camId = camId; }
void Patrol::SetName(std::string name) { this->name = std::move(name); }
void Patrol::SetStayTime(int stayTime) { this->stayTime = stayTime; }
int Patrol::GetId() const { return id; }
int Patrol::GetCamId() const { return camId; }
std::string Patrol::GetName() const { return name; }
int Patrol::GetStayTime() const { return stayTime; }

int Patrol::GetPresetListNum() const { return static_cast<int>(presetList.size()); }

int Patrol::GetPresetFromList(int index, PRESET_INFO* preset) const {
    if (index < 0 || index >= GetPresetListNum() || preset == nullptr) return -1;
    preset->position = presetList[index].position;
    preset->name = presetList[index].name;
    return 0;
}

int Patrol::AddPresetToList(PRESET_INFO preset) {
    presetList.push_back(std::move(preset));
    return GetPresetListNum() - 1;
}

void Patrol::DelAllPreset() { presetList.clear(); }

// ---- patrol row ----

int Patrol::Load(int id) {
    if (id <= 0) {
        PATROL_LOG("Invalid patrol id");
        return -2;
    }
    const std::string sql = std::string("SELECT * FROM ") + gszTablePatrol + " WHERE " + "id" +
                            " = " + itos(id) + ";";
    DBResult_tag* result = nullptr;
    if (OvDBExecute(sql, &result) != 0) {
        PATROL_LOG("Execute SQL command failed\n");
        return -1;
    }
    if (KELODBNumRows(result) != 1) {
        KELODBFreeResult(result);
        return -1;
    }
    unsigned int row = 0;
    KELODBFetchRow(result, &row);
    PutRowIntoClassPatrol(result, row);
    KELODBFreeResult(result);
    return LoadPresetInfo();
}

int Patrol::PutRowIntoClassPatrol(DBResult_tag* result, unsigned int row) {
    if (result == nullptr) {
        PATROL_LOG("Invalid function parameter");
        return -2;
    }
    id = FieldToInt(KELODBFetchField(result, row, "id"));
    camId = FieldToInt(KELODBFetchField(result, row, "camId"));
    name = FieldToText(KELODBFetchField(result, row, "name"));
    stayTime = FieldToInt(KELODBFetchField(result, row, "stayTime"));
    return 0;
}

int Patrol::Save() {
    if (id < 0) {
        PATROL_LOG("Invalid patrol id");
        return -2;
    }
    name.resize(Utf8SafeCut(name, kNameLimit));

    StatementBuffer buffer = NewStatementBuffer();
    if (!buffer) {
        PATROL_LOG("Out of memory");
        return -1;
    }
    const std::string escaped = OvDBEscapeString(name);
    if (id > 0) {
        // A stored patrol: its row and its presets are rewritten by one batch,
        // which the host runs as one transaction. The update takes the row's
        // lock first, so concurrent saves of the patrol are ordered by it.
        if (!FormatStatement(buffer.get(),
                             "UPDATE %s SET camId = %d, name = '%s', stayTime = %d WHERE id = %d;",
                             gszTablePatrol, camId, escaped.c_str(), stayTime, id)) {
            PATROL_LOG("Failed to execute SQL command");
            return -1;
        }
        std::string batch = std::string(buffer.get()) + "\n" + PresetDeleteStatement(id);
        const int tooLong = AppendPresetInserts(batch, buffer.get(), camId, id, presetList);
        if (tooLong >= 0) {
            PATROL_LOG("Failed to execute SQL command to save preset#%d.", tooLong);
            return -1;
        }
        if (OvDBExecute(batch) != 0) {
            PATROL_LOG("Failed to execute SQL command to save patrol %d.", id);
            return -1;
        }
        return 0;
    }

    // A new patrol: the insert gives the id that its presets are stored under.
    ResultHolder result;
    if (!FormatStatement(buffer.get(),
                         "INSERT INTO %s (id, camId, name, stayTime ) VALUES (DEFAULT, %d, "
                         "'%s', %d) RETURNING id;",
                         gszTablePatrol, camId, escaped.c_str(), stayTime) ||
        OvDBExecute(buffer.get(), &result.result) != 0) {
        PATROL_LOG("Failed to execute SQL command");
        return -1;
    }
    if (KELODBNumRows(result.result) != 1) {
        PATROL_LOG("Failed to get result");
        return -1;
    }
    unsigned int row = 0;
    if (KELODBFetchRow(result.result, &row) != 0) {
        PATROL_LOG("Failed to get id");
        return -1;
    }
    id = FieldToInt(KELODBFetchField(result.result, 0, "id"));
    // If the presets fail now, the row stays stored and keeps its id here, so
    // a retried Save updates this row instead of inserting another.
    return SavePresetInfo();
}

int Patrol::Delete() {
    if (id <= 0) {
        PATROL_LOG("Invalid patrol id");
        return -2;
    }
    const std::string sql = std::string("DELETE FROM ") + gszTablePatrol + " WHERE " + "id" +
                            " = " + itos(id) + ";";
    if (OvDBExecute(sql) != 0) {
        PATROL_LOG("Failed to delete patrol %d", id);
        return -1;
    }
    return DelAllPresetInfo();
}

// ---- preset rows ----

int Patrol::LoadPresetInfo() {
    int rc = 0;
    DBResult_tag* result = nullptr;
    if (id < 0) {
        PATROL_LOG("Invalid patrol id");
        rc = -2;
    } else {
        DelAllPreset();
        const std::string sql = std::string("SELECT * FROM ") + gszTablePatrolPresetData +
                                " WHERE " + "patrolId" + " = " + itos(id) + " ORDER BY " +
                                "sequence" + " ASC;";
        if (OvDBExecute(sql, &result) != 0) {
            PATROL_LOG("Execute SQL command failed\n");
            rc = -1;
        } else {
            const int rows = KELODBNumRows(result);
            for (int i = 0; i < rows; ++i) {
                unsigned int row = 0;
                KELODBFetchRow(result, &row);
                PRESET_INFO preset;
                preset.position = FieldToInt(KELODBFetchField(result, row, "position"));
                preset.name = FieldToText(KELODBFetchField(result, row, "name"));
                AddPresetToList(preset);
            }
        }
    }
    // On every way out: release the result (null when no statement ran), then
    // bring the list in line with the camera.
    KELODBFreeResult(result);
    UpdatePresetInfo();
    return rc;
}

int Patrol::SavePresetInfo() {
    if (id <= 0) {
        PATROL_LOG("Invalid patrol id");
        return -2;
    }
    // The delete and the inserts go to the host as one batch, run as one
    // transaction: a failure leaves the stored presets as they were, and a
    // reader sees the old list or the new one, never a mix.
    std::string batch = PatrolLockStatement(id) + "\n" + PresetDeleteStatement(id);
    if (!presetList.empty()) {
        StatementBuffer buffer = NewStatementBuffer();
        if (!buffer) {
            PATROL_LOG("Out of memory");
            return -1;
        }
        const int tooLong = AppendPresetInserts(batch, buffer.get(), camId, id, presetList);
        if (tooLong >= 0) {
            PATROL_LOG("Failed to execute SQL command to save preset#%d.", tooLong);
            return -1;
        }
    }
    if (OvDBExecute(batch) != 0) {
        PATROL_LOG("Failed to execute SQL command to save presets of patrol %d.", id);
        return -1;
    }
    return 0;
}

int Patrol::DelAllPresetInfo() {
    if (id <= 0) {
        PATROL_LOG("Invalid patrol id");
        return -2;
    }
    if (OvDBExecute(PresetDeleteStatement(id)) != 0) {
        PATROL_LOG("Failed to delete preset data of patrol %d", id);
        return -1;
    }
    return 0;
}

// ---- synchronisation with the camera ----

int Patrol::UpdatePresetInfo() {
    const int status = GetCamConnStatus(camId);
    if (status != 1 && status != 5) return -1;

    Camera camera;
    if (camera.Load(camId, 0) != 0) {
        PATROL_LOG("Get camera info. [%d] failed.", camId);
        return -1;
    }
    CameraAPI* api = NewCameraAPIFromRecord(camera);
    if (api == nullptr) {
        PATROL_LOG("Get camera API failed.");
        return -1;
    }
    std::map<int, std::string> cameraPresets;
    if (api->GetPresetList(cameraPresets) != 0) {
        PATROL_LOG("Get camera preset list failed.");
        releaseCameraAPI(api);
        return -1;
    }

    std::vector<PRESET_INFO> kept;
    bool changed = false;
    for (const PRESET_INFO& preset : presetList) {
        if (cameraPresets.count(preset.position) != 0) {
            kept.push_back(preset);
        } else {
            changed = true;
        }
    }
    presetList.swap(kept);
    if (changed) SavePresetInfo();
    releaseCameraAPI(api);
    return 0;
}

// ---- listings ----

std::vector<Patrol> PatrolGetAll(int camId) {
    std::vector<Patrol> patrols;
    if (camId < 0) {
        PATROL_LOG("Invalid camera id %d.", camId);
        return patrols;
    }
    char sql[kStatementSize];
    snprintf(sql, sizeof sql, "SELECT id FROM %s WHERE camId = %d  ORDER BY id;", gszTablePatrol,
             camId);
    DBResult_tag* result = nullptr;
    if (OvDBExecute(sql, &result) != 0) {
        PATROL_LOG("Failed to execute sql command.");
        return patrols;
    }
    const int rows = KELODBNumRows(result);
    for (int i = 0; i < rows; ++i) {
        unsigned int row = 0;
        KELODBFetchRow(result, &row);
        const int id = FieldToInt(KELODBFetchField(result, row, "id"));
        // A fresh patrol per row: a row whose patrol cannot be read (deleted
        // meanwhile, id 0) gives no entry rather than a copy of the previous one.
        Patrol patrol;
        patrol.Load(id);
        if (patrol.GetId() > 0) patrols.push_back(patrol);
    }
    KELODBFreeResult(result);
    return patrols;
}

std::vector<PATROL_PARTIAL_INFO> PatrolPartialGetAll(int camId) {
    std::vector<PATROL_PARTIAL_INFO> list;
    if (camId < 0) {
        PATROL_LOG("Invalid camera id %d.", camId);
        return list;
    }
    char sql[kStatementSize];
    snprintf(sql, sizeof sql, "SELECT id,name FROM %s WHERE camId = %d  ORDER BY id;",
             gszTablePatrol, camId);
    DBResult_tag* result = nullptr;
    if (OvDBExecute(sql, &result) != 0) {
        PATROL_LOG("Failed to execute sql command.");
        return list;
    }
    PATROL_PARTIAL_INFO info;
    info.id = 0;
    const int rows = KELODBNumRows(result);
    for (int i = 0; i < rows; ++i) {
        unsigned int row = 0;
        KELODBFetchRow(result, &row);
        info.id = FieldToInt(KELODBFetchField(result, row, "id"));
        info.name = FieldToText(KELODBFetchField(result, row, "name"));
        list.push_back(info);
    }
    KELODBFreeResult(result);
    return list;
}
