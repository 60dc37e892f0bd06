// Stored PTZ patrols: the record, its storage in the patrol and patrol-preset
// tables, the synchronisation of its presets with the camera, and listings.
#ifndef PATROL_PATROL_H
#define PATROL_PATROL_H

#include <string>
#include <vector>

#include "common/export.h"
#include "host/database.h"

// One preset of a patrol.
typedef struct __tag_PRESET_INFO {
    int position;      // the camera's own preset number
    std::string name;  // the name the preset had when it was added
} PRESET_INFO;

// One patrol of one camera. Not thread-safe: an object is used by one thread at
// a time. Results: 0 success, -1 failure, -2 invalid id or argument.
class PTZ_EXPORT Patrol {
public:
    Patrol();
    Patrol(int camId, std::string name, unsigned int stayTime);
    // Loads patrol `id` when it is 1 or more (the result is dropped).
    explicit Patrol(int id);

    void SetCamId(int camId);
    void SetName(std::string name);
    void SetStayTime(int stayTime);
    int GetId() const;
    int GetCamId() const;
    std::string GetName() const;
    int GetStayTime() const;

    int GetPresetListNum() const;
    // Copies the preset at `index`. -1 (nothing written) for a bad index or null.
    int GetPresetFromList(int index, PRESET_INFO* preset) const;
    // Appends a preset; returns its index.
    int AddPresetToList(PRESET_INFO preset);
    // Empties the in-memory list; stored presets are not touched.
    void DelAllPreset();

    // Reads the patrol row, then its presets (which talks to the camera).
    int Load(int id);
    // Inserts (id 0) or updates (id > 0) the patrol row, then replaces its presets.
    // Cuts the name to 256 bytes first, never inside a UTF-8 character. A
    // stored patrol's row and presets are written in one transaction: on -1
    // nothing of them changed. A new patrol's row is inserted first; if its
    // presets then fail, the row stays (with no presets) and the object keeps
    // its id, so a retried Save updates that row rather than adding another.
    int Save();
    // Deletes the patrol row, then its preset rows. The object keeps its fields.
    int Delete();
    // Copies columns id, camId, name and stayTime of one result row.
    int PutRowIntoClassPatrol(DBResult_tag* result, unsigned int row);

    // Reads the stored presets in sequence order, then brings them in line
    // with the camera (UpdatePresetInfo).
    int LoadPresetInfo();
    // Replaces all stored presets of the patrol by the in-memory list, in one
    // transaction that first takes the patrol row's lock: on -1 the stored
    // presets are as they were, a concurrent Load sees the old list or the
    // new one, and concurrent saves of one patrol leave one writer's list.
    int SavePresetInfo();
    // Deletes all stored presets of the patrol.
    int DelAllPresetInfo();
    // Drops presets whose position the camera no longer reports and, if any
    // was dropped, saves the list. -1 when the camera's list was not obtained.
    int UpdatePresetInfo();

private:
    int id;
    int camId;
    std::string name;
    int stayTime;
    std::vector<PRESET_INFO> presetList;
};

// Id and name of one patrol.
typedef struct __tag_PATROL_PARTIAL_INFO {
    int id;
    std::string name;
} PATROL_PARTIAL_INFO;

// All patrols of a camera, each loaded with its presets, in ascending id order.
// Empty on failure.
PTZ_EXPORT std::vector<Patrol> PatrolGetAll(int camId);
// Id and name of every patrol of a camera, in ascending id order. Empty on failure.
PTZ_EXPORT std::vector<PATROL_PARTIAL_INFO> PatrolPartialGetAll(int camId);

#endif  // PATROL_PATROL_H
