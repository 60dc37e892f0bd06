// The patrol store and the database layer against a real PostgreSQL server.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <thread>

#include "common/pg_test_util.h"
#include "host/camera.h"
#include "hostlib/db/camera_status.h"
#include "hostlib/db/database_config.h"
#include "patrol/patrol.h"
#include "patrol_pg_lists.h"

namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;

PRESET_INFO Preset(int position, const std::string& name) {
    PRESET_INFO p;
    p.position = position;
    p.name = name;
    return p;
}

std::vector<std::pair<int, std::string>> Presets(const Patrol& p) {
    std::vector<std::pair<int, std::string>> out;
    for (int i = 0; i < p.GetPresetListNum(); ++i) {
        PRESET_INFO info;
        p.GetPresetFromList(i, &info);
        out.emplace_back(info.position, info.name);
    }
    return out;
}

class PatrolDatabase : public ::testing::Test {
protected:
    void SetUp() override {
        pgtest::Exec("DROP TRIGGER IF EXISTS ptz_slow ON patrol_preset;");
        pgtest::ResetTables();
        // Cameras without a record: the preset sync stops at the record and
        // leaves the stored presets alone.
        HostResetCamConnStatus();
    }
};

TEST_F(PatrolDatabase, SaveLoadUpdateListDeleteRoundTrip) {
    Patrol p(4, "front gate", 7);
    p.AddPresetToList(Preset(5, "door"));
    p.AddPresetToList(Preset(2, "yard"));
    p.AddPresetToList(Preset(9, "street"));
    ASSERT_EQ(p.Save(), 0);
    ASSERT_GT(p.GetId(), 0);
    const int id = p.GetId();

    Patrol loaded;
    EXPECT_EQ(loaded.Load(id), 0);
    EXPECT_EQ(loaded.GetCamId(), 4);
    EXPECT_EQ(loaded.GetName(), "front gate");
    EXPECT_EQ(loaded.GetStayTime(), 7);
    EXPECT_EQ(Presets(loaded), Presets(p));
    EXPECT_THAT(pgtest::Column("SELECT sequence FROM patrol_preset WHERE patrolId = " + itos(id) +
                                   " ORDER BY sequence;", "sequence"),
                ElementsAre("0", "1", "2"));

    // Update in place: remove the middle preset, rename; sequences close up.
    Patrol edit;
    ASSERT_EQ(edit.Load(id), 0);
    edit.DelAllPreset();
    edit.AddPresetToList(Preset(5, "door"));
    edit.AddPresetToList(Preset(9, "street"));
    edit.SetName("renamed");
    ASSERT_EQ(edit.Save(), 0);
    EXPECT_EQ(edit.GetId(), id);
    EXPECT_THAT(pgtest::Column("SELECT count(*) AS n FROM patrol;", "n"), ElementsAre("1"));
    EXPECT_THAT(pgtest::Column("SELECT position FROM patrol_preset ORDER BY sequence;", "position"),
                ElementsAre("5", "9"));
    EXPECT_THAT(pgtest::Column("SELECT sequence FROM patrol_preset ORDER BY sequence;", "sequence"),
                ElementsAre("0", "1"));

    const auto partial = PatrolPartialGetAll(4);
    ASSERT_EQ(partial.size(), 1u);
    EXPECT_EQ(partial[0].id, id);
    EXPECT_EQ(partial[0].name, "renamed");
    const auto all = PatrolGetAll(4);
    ASSERT_EQ(all.size(), 1u);
    EXPECT_EQ(all[0].GetPresetListNum(), 2);

    EXPECT_EQ(edit.Delete(), 0);
    EXPECT_THAT(pgtest::Column("SELECT count(*) AS n FROM patrol_preset;", "n"), ElementsAre("0"));
    EXPECT_THAT(PatrolGetAll(4), IsEmpty());
    Patrol gone;
    EXPECT_EQ(gone.Load(id), -1);
    // Saving the deleted object again updates no row but writes its presets back.
    EXPECT_EQ(edit.Save(), 0);
    EXPECT_THAT(pgtest::Column("SELECT count(*) AS n FROM patrol;", "n"), ElementsAre("0"));
    EXPECT_THAT(pgtest::Column("SELECT count(*) AS n FROM patrol_preset;", "n"), ElementsAre("2"));
}

TEST_F(PatrolDatabase, AwkwardNamesAreStoredExactly) {
    const std::vector<std::string> names = {
        "it's", "back\\slash\\", "100% %s %d", "two\nlines", "", "caf\xC3\xA9 \xE6\x97\xA5\xE6\x9C\xAC",
        "'; DROP TABLE patrol; --", "\\'\\''",
    };
    for (const std::string& name : names) {
        Patrol p(1, name, 1);
        p.AddPresetToList(Preset(1, name));
        ASSERT_EQ(p.Save(), 0) << name;
        Patrol back;
        ASSERT_EQ(back.Load(p.GetId()), 0);
        EXPECT_EQ(back.GetName(), name);
        EXPECT_EQ(Presets(back)[0].second, name);
    }
    EXPECT_EQ(PatrolPartialGetAll(1).size(), names.size());

    // Long names: cut to 256 bytes, never inside a character, so they still save.
    Patrol ascii(1, std::string(300, 'a'), 1);
    ASSERT_EQ(ascii.Save(), 0);
    Patrol wide(1, std::string(1, 'a') + [] {
        std::string s;
        for (int i = 0; i < 150; ++i) s += "\xC3\xA9";  // 2 bytes each: a character straddles byte 256
        return s;
    }(), 1);
    ASSERT_EQ(wide.Save(), 0);
    Patrol back;
    ASSERT_EQ(back.Load(wide.GetId()), 0);
    EXPECT_EQ(back.GetName().size(), 255u);
    ASSERT_EQ(back.Load(ascii.GetId()), 0);
    EXPECT_EQ(back.GetName(), std::string(256, 'a'));

}

// Every stored preset row, row ids included: equal dumps mean nothing was rewritten.
std::vector<std::string> PresetRows() {
    return pgtest::Column("SELECT concat_ws('|', id, patrolId, position, name, sequence) AS r "
                          "FROM patrol_preset ORDER BY id;", "r");
}

TEST_F(PatrolDatabase, AFailedSaveLeavesTheStoredPresetsAsTheyWere) {
    Patrol p(1, "gate", 1);
    p.AddPresetToList(Preset(1, "one"));
    p.AddPresetToList(Preset(2, "two"));
    p.AddPresetToList(Preset(3, "three"));
    ASSERT_EQ(p.Save(), 0);
    const auto before = PresetRows();
    const std::string invalidUtf8 = "bad \xC3\x28 name";
    const std::string tooLong(20000, 'x');  // its insert cannot fit a statement

    for (const std::string& name : {invalidUtf8, tooLong}) {
        Patrol edit;
        ASSERT_EQ(edit.Load(p.GetId()), 0);
        edit.DelAllPreset();
        edit.AddPresetToList(Preset(1, "one"));
        edit.AddPresetToList(Preset(2, name));
        edit.SetName("renamed");
        EXPECT_EQ(edit.Save(), -1);
        EXPECT_EQ(edit.SavePresetInfo(), -1);
        EXPECT_EQ(PresetRows(), before);
        EXPECT_THAT(pgtest::Column("SELECT name FROM patrol;", "name"), ElementsAre("gate"));
    }

    // A new patrol whose presets fail: its row stays, without presets, and
    // keeps its id in the object, so a retry updates that row.
    Patrol fresh(1, "fresh", 1);
    fresh.AddPresetToList(Preset(4, "four"));
    fresh.AddPresetToList(Preset(5, invalidUtf8));
    EXPECT_EQ(fresh.Save(), -1);
    ASSERT_GT(fresh.GetId(), 0);
    EXPECT_EQ(PresetRows(), before);
    fresh.DelAllPreset();
    fresh.AddPresetToList(Preset(4, "four"));
    EXPECT_EQ(fresh.Save(), 0);
    EXPECT_THAT(pgtest::Column("SELECT count(*) AS n FROM patrol;", "n"), ElementsAre("2"));
    Patrol back;
    ASSERT_EQ(back.Load(fresh.GetId()), 0);
    EXPECT_THAT(Presets(back), ElementsAre(std::make_pair(4, std::string("four"))));
}

// The server stops while a save's statements run: a trigger holds the insert
// of a preset named "slow" until a fast shutdown ends the session.
TEST_F(PatrolDatabase, AServerStoppedInTheMiddleOfASaveCommitsNothingAndARetryWorks) {
    pgtest::Exec("CREATE OR REPLACE FUNCTION ptz_slow() RETURNS trigger AS $$ BEGIN "
                 "IF NEW.name = 'slow' THEN PERFORM pg_sleep(60); END IF; RETURN NEW; END $$ "
                 "LANGUAGE plpgsql;");
    pgtest::Exec("CREATE TRIGGER ptz_slow BEFORE INSERT ON patrol_preset FOR EACH ROW "
                 "EXECUTE FUNCTION ptz_slow();");
    Patrol stored(1, "stored", 1);
    stored.AddPresetToList(Preset(1, "one"));
    ASSERT_EQ(stored.Save(), 0);
    const auto before = PresetRows();

    const auto saveWhileStopping = [](Patrol& p) {
        int rc = 0;
        std::thread saver([&] { rc = p.Save(); });
        bool sleeping = false;
        for (int i = 0; i < 1000 && !sleeping; ++i) {  // up to 10 s
            sleeping = pgtest::Column("SELECT count(*) AS n FROM pg_stat_activity "
                                      "WHERE wait_event = 'PgSleep';", "n") == std::vector<std::string>{"1"};
            if (!sleeping) std::this_thread::sleep_for(std::chrono::milliseconds(10));
        }
        EXPECT_TRUE(sleeping);
        EXPECT_EQ(pgtest::Cluster("down"), 0);
        saver.join();
        EXPECT_EQ(pgtest::Cluster("up"), 0);
        return rc;
    };

    stored.DelAllPreset();
    stored.AddPresetToList(Preset(2, "two"));
    stored.AddPresetToList(Preset(3, "slow"));
    EXPECT_EQ(saveWhileStopping(stored), -1);
    EXPECT_EQ(PresetRows(), before);

    Patrol fresh(1, "fresh", 1);
    fresh.AddPresetToList(Preset(4, "slow"));
    EXPECT_EQ(saveWhileStopping(fresh), -1);
    EXPECT_EQ(PresetRows(), before);

    pgtest::Exec("DROP TRIGGER ptz_slow ON patrol_preset;");
    EXPECT_EQ(fresh.Save(), 0);  // the retry updates the row the first attempt made
    EXPECT_THAT(pgtest::Column("SELECT count(*) AS n FROM patrol;", "n"), ElementsAre("2"));
    EXPECT_THAT(pgtest::Column("SELECT name FROM patrol_preset WHERE patrolId = " + itos(fresh.GetId()) + ";",
                               "name"),
                ElementsAre("slow"));
}

// Two processes each load one patrol, check the list they read, and save
// their own list, over and over: every load sees one writer's whole list and
// the table ends with one writer's list.
TEST_F(PatrolDatabase, ConcurrentSavesAndLoadsOfOnePatrolNeverSeeAMix) {
    Patrol p(1, "shared", 1);
    writerlists::Fill(p, 'A');
    ASSERT_EQ(p.Save(), 0);
    const std::string writer = std::string(std::getenv("PTZ_BINARY_DIR")) + "/tests/patrol/patrol_pg_writer";
    constexpr int kRounds = 100;
    std::vector<FILE*> procs;
    for (const char* tag : {"A", "B"}) {
        const std::string cmd = writer + " " + itos(p.GetId()) + " " + tag + " " + itos(kRounds);
        procs.push_back(popen(cmd.c_str(), "r"));
        ASSERT_NE(procs.back(), nullptr);
    }
    for (FILE* f : procs) {
        char line[128] = {};
        ASSERT_NE(fgets(line, sizeof line, f), nullptr);
        EXPECT_EQ(pclose(f), 0);
        int loads = -1, torn = -1, failed = -1;
        ASSERT_EQ(sscanf(line, "loads=%d torn=%d failed=%d", &loads, &torn, &failed), 3) << line;
        EXPECT_EQ(loads, kRounds);
        EXPECT_EQ(torn, 0);
        EXPECT_EQ(failed, 0);
    }
    Patrol back;
    ASSERT_EQ(back.Load(p.GetId()), 0);
    EXPECT_TRUE(writerlists::IsWholeList(back));
    EXPECT_THAT(pgtest::Column("SELECT sequence FROM patrol_preset ORDER BY sequence;", "sequence"),
                ElementsAre("0", "1", "2", "3", "4", "5", "6", "7"));
}

TEST_F(PatrolDatabase, ListingsAreOrderedByIdAndBadInputGetsClearResults) {
    for (int i = 0; i < 9; ++i) {
        Patrol p(i % 3 == 0 ? 6 : 8, "p" + std::to_string(i), 1);
        ASSERT_EQ(p.Save(), 0);
    }
    const auto list = PatrolPartialGetAll(6);
    ASSERT_EQ(list.size(), 3u);
    EXPECT_LT(list[0].id, list[1].id);
    EXPECT_LT(list[1].id, list[2].id);
    EXPECT_THAT(PatrolGetAll(12345), IsEmpty());
    EXPECT_THAT(PatrolGetAll(-1), IsEmpty());
    Patrol p;
    EXPECT_EQ(p.Load(999999), -1);
    EXPECT_EQ(p.Load(-1), -2);
}

TEST_F(PatrolDatabase, LayerFoldsColumnNamesAndWalksRowsInOrder) {
    DBResult_tag* r = nullptr;
    ASSERT_EQ(OvDBExecute("SELECT 7 AS camId, NULL::text AS name, 'x' AS \"Quoted\" "
                          "UNION ALL SELECT 8, 'b', 'y' ORDER BY 1;", &r), 0);
    EXPECT_EQ(KELODBNumRows(r), 2);
    unsigned int row = 99;
    ASSERT_EQ(KELODBFetchRow(r, &row), 0);
    EXPECT_EQ(row, 0u);
    EXPECT_STREQ(KELODBFetchField(r, row, "camId"), "7");
    EXPECT_STREQ(KELODBFetchField(r, row, "name"), "");  // SQL NULL reads as empty text
    EXPECT_STREQ(KELODBFetchField(r, row, "\"Quoted\""), "x");
    EXPECT_EQ(KELODBFetchField(r, row, "missing"), nullptr);
    EXPECT_EQ(KELODBFetchField(r, 5, "camId"), nullptr);
    ASSERT_EQ(KELODBFetchRow(r, &row), 0);
    EXPECT_EQ(row, 1u);
    EXPECT_NE(KELODBFetchRow(r, &row), 0);
    KELODBFreeResult(r);
    KELODBFreeResult(nullptr);

    DBResult_tag* untouched = nullptr;
    EXPECT_NE(OvDBExecute("SELECT * FROM no_such_table;", &untouched), 0);
    EXPECT_EQ(untouched, nullptr);
    EXPECT_NE(OvDBExecute("this is not sql"), 0);
    EXPECT_EQ(OvDBExecute("SELECT 1;"), 0);  // the connection survived the errors
}

TEST_F(PatrolDatabase, ThreadsSaveAndLoadDifferentPatrolsAtOnce) {
    constexpr int kThreads = 8;
    constexpr int kRounds = 15;
    std::atomic<int> failures{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([t, &failures] {
            Patrol p(100 + t, "thread " + std::to_string(t), static_cast<unsigned>(t));
            for (int round = 0; round < kRounds; ++round) {
                p.DelAllPreset();
                for (int k = 0; k <= round % 5; ++k) p.AddPresetToList(Preset(t * 100 + k, "k"));
                if (p.Save() != 0) ++failures;
                Patrol back;
                if (back.Load(p.GetId()) != 0 || back.GetCamId() != 100 + t ||
                    Presets(back) != Presets(p)) {
                    ++failures;
                }
            }
        });
    }
    for (auto& th : threads) th.join();
    EXPECT_EQ(failures.load(), 0);
    EXPECT_THAT(pgtest::Column("SELECT count(*) AS n FROM patrol;", "n"), ElementsAre(itos(kThreads)));
}

TEST_F(PatrolDatabase, ServerRestartOrOutageIsSurvived) {
    Patrol p(2, "before", 3);
    p.AddPresetToList(Preset(1, "a"));
    ASSERT_EQ(p.Save(), 0);

    ASSERT_EQ(pgtest::Cluster("restart"), 0);
    Patrol back;
    EXPECT_EQ(back.Load(p.GetId()), 0);  // the pooled connection is reset before use
    EXPECT_EQ(back.GetName(), "before");

    ASSERT_EQ(pgtest::Cluster("down"), 0);
    p.SetName("during");
    EXPECT_EQ(p.Save(), -1);
    Patrol none;
    EXPECT_EQ(none.Load(p.GetId()), -1);
    ASSERT_EQ(pgtest::Cluster("up"), 0);

    p.SetName("after");
    EXPECT_EQ(p.Save(), 0);
    EXPECT_EQ(back.Load(p.GetId()), 0);
    EXPECT_EQ(back.GetName(), "after");

    // A stalled server: every statement fails at the timeout, with its
    // connection or with a new one, instead of waiting for the server.
    HostDBSetStatementTimeoutMs(300);
    HostDBSetPoolSize(1);
    ASSERT_EQ(pgtest::Cluster("stall"), 0);
    const auto start = std::chrono::steady_clock::now();
    p.SetName("stalled");
    EXPECT_EQ(p.Save(), -1);   // times out; its connection is closed
    EXPECT_EQ(back.Load(p.GetId()), -1);  // a new connection cannot be made either
    const auto took = std::chrono::steady_clock::now() - start;
    ASSERT_EQ(pgtest::Cluster("resume"), 0);
    HostDBSetStatementTimeoutMs(15000);
    HostDBSetPoolSize(8);
    EXPECT_LT(took, std::chrono::seconds(3));
    p.SetName("resumed");
    EXPECT_EQ(p.Save(), 0);
    EXPECT_EQ(back.Load(p.GetId()), 0);
    EXPECT_EQ(back.GetName(), "resumed");
}

}  // namespace
