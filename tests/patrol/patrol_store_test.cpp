// Patrol storage, preset storage, synchronisation and listings against the
// fake host: exact statements, log lines, call order and result balance.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <syslog.h>

#include "fake/fake_host.h"
#include "patrol/patrol.h"

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

const std::string kPrefix = "patrol.cpp:";

fake::Row PatrolRow(int id, int camId, const std::string& name, int stay) {
    return {{"id", std::to_string(id)}, {"camId", std::to_string(camId)}, {"name", name},
            {"stayTime", std::to_string(stay)}};
}

fake::Row PresetRow(std::optional<std::string> position, std::optional<std::string> name) {
    return {{"position", position}, {"name", name}};
}

std::string PatrolSelect(int id) { return "SELECT * FROM patrol WHERE id = " + std::to_string(id) + ";"; }
std::string PresetSelect(int id) {
    return "SELECT * FROM patrol_preset WHERE patrolId = " + std::to_string(id) + " ORDER BY sequence ASC;";
}
std::string PresetDelete(int id) {
    return "DELETE FROM patrol_preset WHERE patrolId = " + std::to_string(id) + ";";
}
std::string PresetInsert(int camId, int id, int pos, const std::string& name, int seq) {
    return "INSERT INTO patrol_preset (id, camId, patrolId, position, name, sequence ) VALUES (DEFAULT, " +
           std::to_string(camId) + ", " + std::to_string(id) + ", " + std::to_string(pos) + ", '" + name +
           "', " + std::to_string(seq) + ");";
}

std::string PatrolLock(int id) {
    return "SELECT id FROM patrol WHERE id = " + std::to_string(id) + " FOR UPDATE;";
}
// Statements handed over as one transaction: one per line.
std::string Batch(const std::vector<std::string>& statements) {
    std::string out;
    for (const auto& s : statements) out += (out.empty() ? "" : "\n") + s;
    return out;
}

// Log texts without the "file:line:" prefix, which carries a line number.
std::vector<std::string> Messages() {
    std::vector<std::string> out;
    for (const auto& line : fake::Logs()) {
        EXPECT_EQ(line.priority, LOG_ERR);
        EXPECT_EQ(line.text.rfind(kPrefix, 0), 0u) << line.text;
        const size_t func = line.text.find(':', kPrefix.size());
        out.push_back(line.text.substr(func + 1));
    }
    return out;
}

PRESET_INFO Preset(int position, const std::string& name) {
    PRESET_INFO p;
    p.position = position;
    p.name = name;
    return p;
}

std::vector<int> Positions(const Patrol& p) {
    std::vector<int> out;
    for (int i = 0; i < p.GetPresetListNum(); ++i) {
        PRESET_INFO info;
        p.GetPresetFromList(i, &info);
        out.push_back(info.position);
    }
    return out;
}

class PatrolStore : public ::testing::Test {
protected:
    void SetUp() override {
        fake::Reset();
        fake::FakeCamera cam;
        cam.settings.id = 3;
        cam.settings.host = "cam3";
        cam.settings.port = 8080;
        cam.settings.username = "u";
        cam.settings.password = "p";
        cam.settings.vendor = "onvif";
        cam.settings.model = "m";
        cam.settings.channel = "1";
        fake::AddCamera(cam);
        fake::CameraHost("cam3").presets = {{1, "a"}, {2, "b"}, {3, "c"}, {7, "g"}};
    }
    void TearDown() override {
        EXPECT_EQ(fake::ResultsOutstanding(), 0);
        EXPECT_EQ(fake::ApisOutstanding(), 0);
    }
    // Patrol 12 of camera 3 with stored presets at `positions`.
    void StorePatrol(const std::vector<int>& positions) {
        fake::OnSql(PatrolSelect(12), {0, {PatrolRow(12, 3, "gate", 4)}});
        std::vector<fake::Row> rows;
        for (int p : positions) rows.push_back(PresetRow(std::to_string(p), "n" + std::to_string(p)));
        fake::OnSql(PresetSelect(12), {0, rows});
    }
};

TEST_F(PatrolStore, PresetListIndexesAndRefusesBadOnesWithoutWriting) {
    Patrol p;
    EXPECT_EQ(p.AddPresetToList(Preset(3, "door")), 0);
    EXPECT_EQ(p.AddPresetToList(Preset(8, "yard")), 1);
    PRESET_INFO out = Preset(-1, "untouched");
    for (int bad : {2, -1}) EXPECT_EQ(p.GetPresetFromList(bad, &out), -1);
    EXPECT_EQ(p.GetPresetFromList(0, nullptr), -1);
    EXPECT_EQ(out.name, "untouched");
    EXPECT_EQ(p.GetPresetFromList(1, &out), 0);
    EXPECT_EQ(out.position, 8);
    EXPECT_EQ(out.name, "yard");
    Patrol never(-4);  // ids below 1 are not loaded
    EXPECT_THAT(fake::Statements(), IsEmpty());
}

TEST_F(PatrolStore, LoadReadsRowThenPresetsThenAsksTheCamera) {
    StorePatrol({2, 1});
    Patrol p;
    EXPECT_EQ(p.Load(12), 0);
    EXPECT_EQ(p.GetId(), 12);
    EXPECT_EQ(p.GetCamId(), 3);
    EXPECT_EQ(p.GetName(), "gate");
    EXPECT_EQ(p.GetStayTime(), 4);
    EXPECT_THAT(Positions(p), ElementsAre(2, 1));
    EXPECT_THAT(fake::Statements(), ElementsAre(PatrolSelect(12), PresetSelect(12)));
    EXPECT_THAT(fake::CameraCallNames(),
                ElementsAre("GetCamConnStatus 3", "Camera::Load 3", "newCameraAPI cam3 8080 u p onvif m 1",
                            "GetPresetList", "releaseCameraAPI"));
    EXPECT_THAT(Messages(), IsEmpty());
}

TEST_F(PatrolStore, LoadRefusesBadIdsAndLeavesTheObjectOnFailures) {
    Patrol p(3, "keep", 9);
    p.AddPresetToList(Preset(1, "x"));
    EXPECT_EQ(p.Load(0), -2);
    EXPECT_EQ(p.Load(-5), -2);
    EXPECT_THAT(fake::Statements(), IsEmpty());

    fake::OnSql(PatrolSelect(40), {-1, {}});
    EXPECT_EQ(p.Load(40), -1);
    fake::OnSql(PatrolSelect(41), {0, {}});  // no row
    EXPECT_EQ(p.Load(41), -1);
    fake::OnSql(PatrolSelect(42), {0, {PatrolRow(42, 3, "a", 1), PatrolRow(42, 3, "b", 1)}});
    EXPECT_EQ(p.Load(42), -1);

    EXPECT_EQ(p.GetId(), 0);
    EXPECT_EQ(p.GetName(), "keep");
    EXPECT_EQ(p.GetPresetListNum(), 1);
    EXPECT_THAT(Messages(), ElementsAre("Load(): Invalid patrol id", "Load(): Invalid patrol id",
                                        "Load(): Execute SQL command failed\n"));
    EXPECT_EQ(fake::NullResultsFreed(), 0);  // no result to release after a failed query
}

TEST_F(PatrolStore, PresetFieldsConvertLikeStrtolAndNullsReadAsZeroOrEmpty) {
    fake::OnSql(PatrolSelect(12), {0, {{{"id", "12"}, {"camId", std::nullopt}, {"name", std::nullopt},
                                        {"stayTime", " -3x"}}}});
    fake::OnSql(PresetSelect(12), {0, {PresetRow(std::nullopt, "zero"), PresetRow("7abc", std::nullopt)}});
    fake::CameraHost("").presets = {{0, ""}, {7, ""}};  // camId 0 -> camera never added: host ""
    Patrol p;
    EXPECT_EQ(p.Load(12), 0);
    EXPECT_EQ(p.GetCamId(), 0);
    EXPECT_EQ(p.GetName(), "");
    EXPECT_EQ(p.GetStayTime(), -3);
    PRESET_INFO a, b;
    ASSERT_EQ(p.GetPresetFromList(0, &a), 0);
    ASSERT_EQ(p.GetPresetFromList(1, &b), 0);
    EXPECT_EQ(a.position, 0);
    EXPECT_EQ(a.name, "zero");
    EXPECT_EQ(b.position, 7);
    EXPECT_EQ(b.name, "");
}

TEST_F(PatrolStore, SaveInsertsTakesTheNewIdThenRewritesPresetsInOneBatch) {
    Patrol p(3, "it's", 5);
    p.AddPresetToList(Preset(7, "o'clock"));
    p.AddPresetToList(Preset(1, "100%"));
    fake::OnSql("INSERT INTO patrol ", {0, {{{"id", "31"}}}});
    EXPECT_EQ(p.Save(), 0);
    EXPECT_EQ(p.GetId(), 31);
    const std::string presets = Batch({PresetDelete(31), PresetInsert(3, 31, 7, "o''clock", 0),
                                       PresetInsert(3, 31, 1, "100%", 1)});
    EXPECT_THAT(fake::Statements(),
                ElementsAre("INSERT INTO patrol (id, camId, name, stayTime ) VALUES (DEFAULT, 3, 'it''s', 5) "
                            "RETURNING id;",
                            Batch({PatrolLock(31), presets})));

    // Now an update of the same row, in the same transaction as its presets;
    // the update takes the row's lock first.
    EXPECT_EQ(p.Save(), 0);
    EXPECT_EQ(fake::Statements().back(),
              Batch({"UPDATE patrol SET camId = 3, name = 'it''s', stayTime = 5 WHERE id = 31;", presets}));
    EXPECT_EQ(fake::Statements().size(), 3u);
    EXPECT_EQ(fake::ResultsOutstanding(), 0);
}

TEST_F(PatrolStore, SaveFailuresKeepIdZeroAndWriteNoPresets) {
    Patrol p(3, "x", 1);
    p.AddPresetToList(Preset(1, "a"));
    fake::OnSql("INSERT INTO patrol ", {-1, {}}, 1);
    EXPECT_EQ(p.Save(), -1);
    EXPECT_EQ(fake::NullResultsFreed(), 1);  // the untouched handle is still released
    fake::OnSql("INSERT INTO patrol ", {0, {}}, 1);
    EXPECT_EQ(p.Save(), -1);
    fake::OnSql("INSERT INTO patrol ", {0, {{{"id", "5"}}, {{"id", "6"}}}}, 1);
    EXPECT_EQ(p.Save(), -1);
    EXPECT_EQ(p.GetId(), 0);
    EXPECT_EQ(fake::Statements().size(), 3u);
    EXPECT_THAT(Messages(), ElementsAre("Save(): Failed to execute SQL command", "Save(): Failed to get result",
                                        "Save(): Failed to get result"));

    Patrol bad(3, std::string(300, 'n'), 1);
    bad.SetName(std::string(300, 'n'));
    // A negative id cannot be set from outside; a row read with one gives it.
    fake::OnSql(PatrolSelect(77), {0, {PatrolRow(-3, 3, std::string(300, 'n'), 1)}});
    bad.Load(77);
    ASSERT_EQ(bad.GetId(), -3);
    const size_t before = fake::Statements().size();
    EXPECT_EQ(bad.Save(), -2);
    EXPECT_EQ(bad.GetName().size(), 300u);  // not cut
    EXPECT_EQ(fake::Statements().size(), before);
}

TEST_F(PatrolStore, SaveCutsNamesAt256BytesWithoutSplittingUtf8) {
    fake::OnSql("INSERT INTO patrol ", {0, {{{"id", "1"}}}});
    Patrol ascii(3, std::string(300, 'a'), 1);
    ascii.Save();
    EXPECT_EQ(ascii.GetName(), std::string(256, 'a'));

    // 255 ASCII bytes then a 3-byte character: bytes 256..258 would be split.
    Patrol utf(3, std::string(255, 'a') + "\xE2\x82\xAC" + "tail", 1);
    utf.Save();
    EXPECT_EQ(utf.GetName(), std::string(255, 'a'));

    // A 2-byte character ending exactly at byte 256 stays whole.
    Patrol exact(3, std::string(254, 'a') + "\xC3\xA9" + "more", 1);
    exact.Save();
    EXPECT_EQ(exact.GetName(), std::string(254, 'a') + "\xC3\xA9");

    // Bytes that are not valid UTF-8 are cut at 256 exactly.
    Patrol junk(3, std::string(255, 'a') + "\x80\x80\x80", 1);
    junk.Save();
    EXPECT_EQ(junk.GetName().size(), 256u);
    Patrol stray(3, std::string(254, 'a') + "\xE2\x82" + "x", 1);  // truncated sequence
    stray.Save();
    EXPECT_EQ(stray.GetName().size(), 256u);
}

TEST_F(PatrolStore, APresetRewriteIsAllOrNothing) {
    StorePatrol({});
    Patrol p;
    p.Load(12);
    p.AddPresetToList(Preset(1, "a"));
    p.AddPresetToList(Preset(2, "b"));
    const size_t loaded = fake::Statements().size();

    // The server refuses the batch: nothing else is tried.
    fake::OnSql(PresetInsert(3, 12, 2, "b", 1), {-1, {}}, 2);
    EXPECT_EQ(p.SavePresetInfo(), -1);
    EXPECT_EQ(p.Save(), -1);
    const auto sql = fake::Statements();
    EXPECT_THAT(std::vector<std::string>(sql.begin() + loaded, sql.end()),
                ElementsAre(Batch({PatrolLock(12), PresetDelete(12), PresetInsert(3, 12, 1, "a", 0),
                                   PresetInsert(3, 12, 2, "b", 1)}),
                            Batch({"UPDATE patrol SET camId = 3, name = 'gate', stayTime = 4 WHERE id = 12;",
                                   PresetDelete(12), PresetInsert(3, 12, 1, "a", 0),
                                   PresetInsert(3, 12, 2, "b", 1)})));

    // An insert that cannot fit the statement buffer fails the save before
    // anything runs, the patrol's update included.
    p.AddPresetToList(Preset(3, std::string(17000, 'z')));
    EXPECT_EQ(p.SavePresetInfo(), -1);
    EXPECT_EQ(p.Save(), -1);
    EXPECT_EQ(fake::Statements().size(), loaded + 2);
    EXPECT_THAT(Messages(),
                ElementsAre("SavePresetInfo(): Failed to execute SQL command to save presets of patrol 12.",
                            "Save(): Failed to execute SQL command to save patrol 12.",
                            "SavePresetInfo(): Failed to execute SQL command to save preset#2.",
                            "Save(): Failed to execute SQL command to save preset#2."));

    // An empty list: the lock and the delete, still as one batch.
    p.DelAllPreset();
    EXPECT_EQ(p.SavePresetInfo(), 0);
    EXPECT_EQ(fake::Statements().back(), Batch({PatrolLock(12), PresetDelete(12)}));
}

TEST_F(PatrolStore, IdZeroIsRefusedForSaveAndDeleteButLoadsPresets) {
    Patrol p;
    EXPECT_EQ(p.SavePresetInfo(), -2);
    EXPECT_EQ(p.DelAllPresetInfo(), -2);
    EXPECT_EQ(p.Delete(), -2);
    EXPECT_THAT(fake::Statements(), IsEmpty());
    EXPECT_EQ(p.LoadPresetInfo(), 0);
    EXPECT_THAT(fake::Statements(), ElementsAre(PresetSelect(0)));
    EXPECT_THAT(Messages(), ElementsAre("SavePresetInfo(): Invalid patrol id", "DelAllPresetInfo(): Invalid patrol id",
                                        "Delete(): Invalid patrol id",
                                        "UpdatePresetInfo(): Get camera info. [0] failed."));
}

TEST_F(PatrolStore, LoadPresetInfoFailureEmptiesTheListAndStillSynchronises) {
    StorePatrol({1, 2});
    Patrol p;
    p.Load(12);
    const size_t calls = fake::CameraCalls().size();
    fake::OnSqlHandler([](const std::string& sql) -> std::optional<fake::Answer> {
        if (sql == PresetSelect(12)) return fake::Answer{-1, {}};
        return std::nullopt;
    });
    EXPECT_EQ(p.LoadPresetInfo(), -1);
    EXPECT_EQ(p.GetPresetListNum(), 0);
    EXPECT_GT(fake::CameraCalls().size(), calls);  // synchronisation ran
    EXPECT_THAT(Messages(), ElementsAre("LoadPresetInfo(): Execute SQL command failed\n"));
}

TEST_F(PatrolStore, DeleteRemovesRowThenPresetsAndKeepsFields) {
    StorePatrol({1});
    Patrol p;
    p.Load(12);
    EXPECT_EQ(p.Delete(), 0);
    const auto sql = fake::Statements();
    EXPECT_THAT(std::vector<std::string>(sql.end() - 2, sql.end()),
                ElementsAre("DELETE FROM patrol WHERE id = 12;", PresetDelete(12)));
    EXPECT_EQ(p.GetId(), 12);
    EXPECT_EQ(p.GetPresetListNum(), 1);

    fake::OnSqlHandler([](const std::string& sql) -> std::optional<fake::Answer> {
        if (sql.rfind("DELETE FROM patrol WHERE", 0) == 0) return fake::Answer{-1, {}};
        return std::nullopt;
    });
    const size_t before = fake::Statements().size();
    EXPECT_EQ(p.Delete(), -1);
    EXPECT_EQ(fake::Statements().size(), before + 1);  // presets untouched
    EXPECT_THAT(Messages(), ElementsAre("Delete(): Failed to delete patrol 12"));
}

TEST_F(PatrolStore, SyncDropsMissingPositionsKeepsOrderNamesAndDuplicates) {
    StorePatrol({1, 2, 3, 1, 5});  // the camera has 1, 2, 3, 7
    fake::CameraHost("cam3").presets = {{1, "camera name"}, {3, "c"}, {7, "g"}};
    Patrol p;
    EXPECT_EQ(p.Load(12), 0);
    EXPECT_THAT(Positions(p), ElementsAre(1, 3, 1));
    PRESET_INFO first;
    p.GetPresetFromList(0, &first);
    EXPECT_EQ(first.name, "n1");  // the stored name, not the camera's
    const auto sql = fake::Statements();
    EXPECT_THAT(std::vector<std::string>(sql.begin() + 2, sql.end()),
                ElementsAre(Batch({PatrolLock(12), PresetDelete(12), PresetInsert(3, 12, 1, "n1", 0),
                                   PresetInsert(3, 12, 3, "n3", 1), PresetInsert(3, 12, 1, "n1", 2)})));
}

TEST_F(PatrolStore, SyncWritesNothingWhenNothingIsDroppedAndDropsAllForAnEmptyCamera) {
    StorePatrol({1, 2});
    Patrol p;
    EXPECT_EQ(p.Load(12), 0);
    EXPECT_EQ(fake::Statements().size(), 2u);  // preset 7 on the camera is not added, nothing written
    EXPECT_THAT(Positions(p), ElementsAre(1, 2));

    fake::CameraHost("cam3").presets.clear();
    EXPECT_EQ(p.UpdatePresetInfo(), 0);
    EXPECT_EQ(p.GetPresetListNum(), 0);
    EXPECT_EQ(fake::Statements().back(), Batch({PatrolLock(12), PresetDelete(12)}));
}

TEST_F(PatrolStore, SyncFailuresLeaveTheListAndReleaseWhatWasMade) {
    StorePatrol({1, 9});
    Patrol p;
    fake::FakeCamera offline;
    offline.settings.id = 3;
    offline.settings.host = "cam3";
    offline.connStatus = 0;
    fake::AddCamera(offline);
    EXPECT_EQ(p.Load(12), 0);  // the load's own result, whatever the sync gave
    EXPECT_THAT(Positions(p), ElementsAre(1, 9));
    EXPECT_THAT(fake::CameraCallNames(), ElementsAre("GetCamConnStatus 3"));  // not contacted
    EXPECT_THAT(Messages(), IsEmpty());

    offline.connStatus = 5;
    offline.loadFails = true;
    fake::AddCamera(offline);
    EXPECT_EQ(p.UpdatePresetInfo(), -1);
    offline.loadFails = false;
    fake::AddCamera(offline);
    fake::CameraHost("cam3").apiNull = true;
    EXPECT_EQ(p.UpdatePresetInfo(), -1);
    fake::CameraHost("cam3").apiNull = false;
    fake::CameraHost("cam3").presetListRc = -1;
    EXPECT_EQ(p.UpdatePresetInfo(), -1);
    EXPECT_THAT(Positions(p), ElementsAre(1, 9));
    EXPECT_EQ(fake::Statements().size(), 2u);
    EXPECT_THAT(Messages(), ElementsAre("UpdatePresetInfo(): Get camera info. [3] failed.",
                                        "UpdatePresetInfo(): Get camera API failed.",
                                        "UpdatePresetInfo(): Get camera preset list failed."));
}

TEST_F(PatrolStore, ListingsUseExactStatementsAndRefuseNegativeCameras) {
    EXPECT_THAT(PatrolGetAll(-1), IsEmpty());
    EXPECT_THAT(PatrolPartialGetAll(-1), IsEmpty());
    EXPECT_THAT(fake::Statements(), IsEmpty());
    fake::OnSql("SELECT id", {-1, {}});
    EXPECT_THAT(PatrolGetAll(0), IsEmpty());
    EXPECT_THAT(PatrolPartialGetAll(0), IsEmpty());
    EXPECT_THAT(fake::Statements(), ElementsAre("SELECT id FROM patrol WHERE camId = 0  ORDER BY id;",
                                                "SELECT id,name FROM patrol WHERE camId = 0  ORDER BY id;"));
    EXPECT_THAT(Messages(), ElementsAre("PatrolGetAll(): Invalid camera id -1.",
                                        "PatrolPartialGetAll(): Invalid camera id -1.",
                                        "PatrolGetAll(): Failed to execute sql command.",
                                        "PatrolPartialGetAll(): Failed to execute sql command."));
    EXPECT_EQ(fake::NullResultsFreed(), 0);
}

TEST_F(PatrolStore, ListingsSkipRowsWhosePatrolCannotBeRead) {
    fake::OnSql("SELECT id FROM", {0, {{{"id", "3"}}, {{"id", std::nullopt}}, {{"id", "4"}}, {{"id", "5"}}}});
    fake::OnSql(PatrolSelect(3), {0, {PatrolRow(3, 3, "three", 1)}});
    fake::OnSql(PatrolSelect(4), {0, {}});  // deleted after the listing
    fake::OnSql(PatrolSelect(5), {0, {PatrolRow(5, 3, "five", 1)}});
    const auto all = PatrolGetAll(3);
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0].GetName(), "three");
    EXPECT_EQ(all[1].GetName(), "five");

    fake::OnSql("SELECT id,name", {0, {{{"id", "3"}, {"name", "three"}}, {{"id", std::nullopt}, {"name", std::nullopt}}}});
    const auto partial = PatrolPartialGetAll(3);
    ASSERT_EQ(partial.size(), 2u);
    EXPECT_EQ(partial[0].id, 3);
    EXPECT_EQ(partial[0].name, "three");
    EXPECT_EQ(partial[1].id, 0);
    EXPECT_EQ(partial[1].name, "");
}

}  // namespace
