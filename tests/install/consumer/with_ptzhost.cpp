// A host that uses ptzpatrol with our host layer: saves a patrol on the
// PostgreSQL server named by the PG* environment and loads it back.
#include <cstdio>

#include "hostlib/db/camera_status.h"
#include "patrol/patrol.h"

int main() {
    HostSetCamConnStatus(7, 0);  // no camera here: loads leave the presets alone
    Patrol saved(7, "install check", 5);
    saved.AddPresetToList({1, "door"});
    saved.AddPresetToList({3, "yard"});
    if (saved.Save() != 0) return std::puts("save failed"), 1;
    Patrol loaded;
    if (loaded.Load(saved.GetId()) != 0 || loaded.GetName() != "install check" ||
        loaded.GetPresetListNum() != 2) {
        return std::puts("load failed"), 1;
    }
    std::printf("ptzhost: saved and loaded patrol %d\n", loaded.GetId());
    return saved.Delete() == 0 ? 0 : 1;
}
