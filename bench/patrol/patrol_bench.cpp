// The patrol store through our database layer, beside the same statements
// sent with bare libpq on one connection, in the same run.
// Needs a server: run through scripts/bench.sh (throwaway cluster), e.g.
//   scripts/bench.sh patrol_bench --benchmark_repetitions=10
//       --benchmark_enable_random_interleaving=true --benchmark_report_aggregates_only=true
#include <benchmark/benchmark.h>
#include <libpq-fe.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "hostlib/db/camera_status.h"
#include "patrol/patrol.h"
#include "ratio_reporter.h"

namespace {

constexpr int kCam = 77;        // camera of the save/load patrol
constexpr int kListCam = 78;    // camera with 100 patrols
constexpr int kPresets = 32;

PGconn* Bare() {
    static PGconn* conn = [] {
        PGconn* c = PQconnectdb("client_encoding=UTF8");
        if (PQstatus(c) != CONNECTION_OK) {
            std::fprintf(stderr, "bench: cannot connect: %s", PQerrorMessage(c));
            std::exit(1);
        }
        return c;
    }();
    return conn;
}

PGresult* BareExec(const std::string& sql) {
    PGresult* r = PQexec(Bare(), sql.c_str());
    const ExecStatusType st = PQresultStatus(r);
    if (st != PGRES_TUPLES_OK && st != PGRES_COMMAND_OK) {
        std::fprintf(stderr, "bench: %s: %s", sql.c_str(), PQerrorMessage(Bare()));
        std::exit(1);
    }
    return r;
}

// Every save deletes and rewrites 32 rows; vacuum now and then, outside the
// timing, so both sides are measured on a table in the same steady state
// rather than on a growing pile of dead rows.
void Vacuum(benchmark::State& state, long& count) {
    if (++count % 32 != 0) return;
    state.PauseTiming();
    PQclear(BareExec("VACUUM patrol, patrol_preset;"));
    state.ResumeTiming();
}

void Setup() {
    static bool done = false;
    if (done) return;
    done = true;
    PQclear(BareExec("TRUNCATE patrol, patrol_preset, camera RESTART IDENTITY;"));
    // Offline cameras: the preset sync stops before the camera, so both
    // sides send exactly the same statements.
    HostSetCamConnStatus(kCam, 0);
    HostSetCamConnStatus(kListCam, 0);
    for (int i = 0; i < 100; ++i) {
        Patrol p(kListCam, "listed " + std::to_string(i), 5);
        for (int k = 0; k < 4; ++k) {
            PRESET_INFO preset{k + 1, "preset " + std::to_string(k)};
            p.AddPresetToList(preset);
        }
        if (p.Save() != 0) std::exit(1);
    }
}

Patrol& SavedPatrol() {
    static Patrol p = [] {
        Patrol q(kCam, "bench patrol", 10);
        for (int k = 0; k < kPresets; ++k) {
            PRESET_INFO preset{k + 1, "preset's name " + std::to_string(k)};
            q.AddPresetToList(preset);
        }
        if (q.Save() != 0) std::exit(1);
        return q;
    }();
    return p;
}

void SaveLoad32(benchmark::State& state) {
    Setup();
    Patrol& p = SavedPatrol();
    Patrol back;
    long count = 0;
    for (auto _ : state) {
        if (p.Save() != 0 || back.Load(p.GetId()) != 0) state.SkipWithError("store failed");
        Vacuum(state, count);
    }
}
BENCHMARK(SaveLoad32)->Name("SaveLoad32/ours")->Unit(benchmark::kMicrosecond);

void SaveLoad32Bare(benchmark::State& state) {
    Setup();
    Patrol& p = SavedPatrol();
    const std::string id = std::to_string(p.GetId());
    char buf[16384];
    long count = 0;
    for (auto _ : state) {
        Vacuum(state, count);
        std::string name = p.GetName();
        std::vector<char> esc(name.size() * 2 + 1);
        PQescapeStringConn(Bare(), esc.data(), name.data(), name.size(), nullptr);
        snprintf(buf, sizeof buf, "UPDATE %s SET camId = %d, name = '%s', stayTime = %d WHERE id = %d;",
                 "patrol", kCam, esc.data(), 10, p.GetId());
        PQclear(BareExec(buf));
        PQclear(BareExec("DELETE FROM patrol_preset WHERE patrolId = " + id + ";"));
        for (int i = 0; i < kPresets; ++i) {
            PRESET_INFO preset;
            p.GetPresetFromList(i, &preset);
            std::vector<char> pe(preset.name.size() * 2 + 1);
            PQescapeStringConn(Bare(), pe.data(), preset.name.data(), preset.name.size(), nullptr);
            snprintf(buf, sizeof buf,
                     "INSERT INTO %s (id, camId, patrolId, position, name, sequence ) VALUES (DEFAULT, %d, "
                     "%d, %d, '%s', %d);",
                     "patrol_preset", kCam, p.GetId(), preset.position, pe.data(), i);
            PQclear(BareExec(buf));
        }
        PGresult* row = BareExec("SELECT * FROM patrol WHERE id = " + id + ";");
        benchmark::DoNotOptimize(PQgetvalue(row, 0, PQfnumber(row, "name")));
        PQclear(row);
        PGresult* presets = BareExec("SELECT * FROM patrol_preset WHERE patrolId = " + id + " ORDER BY sequence ASC;");
        std::vector<PRESET_INFO> list;
        for (int i = 0; i < PQntuples(presets); ++i) {
            list.push_back({static_cast<int>(strtol(PQgetvalue(presets, i, PQfnumber(presets, "position")), nullptr, 10)),
                            PQgetvalue(presets, i, PQfnumber(presets, "name"))});
        }
        benchmark::DoNotOptimize(list.data());
        PQclear(presets);
    }
}
BENCHMARK(SaveLoad32Bare)->Name("SaveLoad32/baseline")->Unit(benchmark::kMicrosecond);

void PartialList100(benchmark::State& state) {
    Setup();
    for (auto _ : state) {
        if (PatrolPartialGetAll(kListCam).size() != 100) state.SkipWithError("listing failed");
    }
}
BENCHMARK(PartialList100)->Name("PartialGetAll100/ours")->Unit(benchmark::kMicrosecond);

void PartialList100Bare(benchmark::State& state) {
    Setup();
    for (auto _ : state) {
        PGresult* r = BareExec("SELECT id,name FROM patrol WHERE camId = 78  ORDER BY id;");
        std::vector<PATROL_PARTIAL_INFO> list;
        for (int i = 0; i < PQntuples(r); ++i) {
            list.push_back({static_cast<int>(strtol(PQgetvalue(r, i, PQfnumber(r, "id")), nullptr, 10)),
                            PQgetvalue(r, i, PQfnumber(r, "name"))});
        }
        benchmark::DoNotOptimize(list.data());
        PQclear(r);
    }
}
BENCHMARK(PartialList100Bare)->Name("PartialGetAll100/baseline")->Unit(benchmark::kMicrosecond);

void GetAll100(benchmark::State& state) {
    Setup();
    for (auto _ : state) {
        if (PatrolGetAll(kListCam).size() != 100) state.SkipWithError("listing failed");
    }
}
BENCHMARK(GetAll100)->Name("GetAll100/ours")->Unit(benchmark::kMicrosecond);

void GetAll100Bare(benchmark::State& state) {
    Setup();
    for (auto _ : state) {
        PGresult* ids = BareExec("SELECT id FROM patrol WHERE camId = 78  ORDER BY id;");
        std::vector<Patrol> list;
        for (int i = 0; i < PQntuples(ids); ++i) {
            const std::string id = PQgetvalue(ids, i, 0);
            PGresult* row = BareExec("SELECT * FROM patrol WHERE id = " + id + ";");
            Patrol p(static_cast<int>(strtol(PQgetvalue(row, 0, PQfnumber(row, "camId")), nullptr, 10)),
                     PQgetvalue(row, 0, PQfnumber(row, "name")),
                     static_cast<unsigned>(strtol(PQgetvalue(row, 0, PQfnumber(row, "stayTime")), nullptr, 10)));
            PQclear(row);
            PGresult* presets = BareExec("SELECT * FROM patrol_preset WHERE patrolId = " + id + " ORDER BY sequence ASC;");
            for (int k = 0; k < PQntuples(presets); ++k) {
                p.AddPresetToList({static_cast<int>(strtol(PQgetvalue(presets, k, PQfnumber(presets, "position")), nullptr, 10)),
                                   PQgetvalue(presets, k, PQfnumber(presets, "name"))});
            }
            PQclear(presets);
            list.push_back(p);
        }
        PQclear(ids);
        benchmark::DoNotOptimize(list.data());
    }
}
BENCHMARK(GetAll100Bare)->Name("GetAll100/baseline")->Unit(benchmark::kMicrosecond);

}  // namespace

RATIO_BENCHMARK_MAIN({{"SaveLoad32", "<= 1.10"}, {"PartialGetAll100", "<= 1.10"}, {"GetAll100", "<= 1.10"}});
