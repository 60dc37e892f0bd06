// Preset synchronisation end to end: a patrol stored in PostgreSQL, its
// camera a simulator reached through the ONVIF driver, Patrol::Load dropping
// what the camera no longer has.
#include <gtest/gtest.h>

#include "camera/sim_http.h"
#include "common/pg_test_util.h"
#include "hostlib/db/camera_status.h"
#include "hostlib/camera/onvif_camera.h"
#include "hostlib/camera/onvif_soap.h"
#include "patrol/patrol.h"
#include "support/camsim.h"

namespace {

using Stored = std::vector<std::string>;
const int kCam = 7;

// "sequence:position" of the patrol's stored presets after Patrol::Load,
// which must be the loaded patrol's presets too, names kept.
Stored Load(int id) {
    Patrol p;
    EXPECT_EQ(p.Load(id), 0);
    std::string sql =
        "SELECT sequence || ':' || position AS s FROM patrol_preset WHERE patrolId = ";
    Stored loaded, stored = pgtest::Column(sql + itos(id) + " ORDER BY sequence;", "s");
    for (int i = 0; i < p.GetPresetListNum(); ++i) {
        PRESET_INFO info;
        p.GetPresetFromList(i, &info);
        EXPECT_EQ(info.name, "p" + itos(info.position));
        loaded.push_back(itos(i) + ":" + itos(info.position));
    }
    EXPECT_EQ(loaded, stored);
    return stored;
}

TEST(PresetSync, LoadDropsPresetsTheCameraNoLongerHasOnlyWhenOnline) {
    pgtest::ResetTables();
    HostResetCamConnStatus();
    onvif::ForgetCameras();
    CamSim sim;
    pgtest::Exec("INSERT INTO camera (id, host, port, username, password, vendor) VALUES (" +
                 itos(kCam) + ", '127.0.0.1', " + itos(sim.Port()) +
                 ", 'admin', 'secret', 'onvif');");
    const int attic = onvif::PresetPosition("Attic_A");
    const std::string a = itos(attic);
    Patrol patrol(kCam, "tour", 5);
    for (int position : {5, 1, attic, 2}) patrol.AddPresetToList({position, "p" + itos(position)});
    ASSERT_EQ(patrol.Save(), 0);
    const int id = patrol.GetId();

    sim.SetPresets({{"2", "Door"}, {"5", "Gate"}, {"Attic_A", "Attic"}, {"9", "Yard"}});
    long before = SimRequests(sim.Port());
    HostSetCamConnStatus(kCam, CAM_CONN_OFFLINE);
    EXPECT_EQ(Load(id), (Stored{"0:5", "1:1", "2:" + a, "3:2"}));
    EXPECT_EQ(SimRequests(sim.Port()), before);       // not contacted
    HostSetCamConnStatus(kCam, CAM_CONN_ONLINE_PTZ);  // 5 lets presets be read, as 1 does
    EXPECT_EQ(Load(id), (Stored{"0:5", "1:" + a, "2:2"}));
    // A camera that cannot be reached is no empty list: the patrol stays.
    HostSetCamConnStatus(kCam, CAM_CONN_ONLINE);
    sim.SetFault("status", "500");
    EXPECT_EQ(Load(id).size(), 3u);
    // A camera with no presets left empties the patrol.
    sim.ClearFaults();
    sim.SetPresets({});
    EXPECT_EQ(Load(id), Stored{});
}

}  // namespace
