// Helpers for tests that run against the throwaway PostgreSQL cluster
// (scripts/pg_cluster.sh, started by the CTest fixture; PGHOST etc. are set).
#ifndef TESTS_COMMON_PG_TEST_UTIL_H
#define TESTS_COMMON_PG_TEST_UTIL_H

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <vector>

#include "host/database.h"

namespace pgtest {

// Runs a statement through the host database layer; the rows' values of
// `column`, in order.
inline std::vector<std::string> Column(const std::string& sql, const char* column) {
    std::vector<std::string> out;
    DBResult_tag* result = nullptr;
    EXPECT_EQ(OvDBExecute(sql, &result), 0) << sql;
    unsigned int row = 0;
    while (KELODBFetchRow(result, &row) == 0) {
        const char* v = KELODBFetchField(result, row, column);
        out.push_back(v ? v : "<null>");
    }
    KELODBFreeResult(result);
    return out;
}

inline void Exec(const std::string& sql) { ASSERT_EQ(OvDBExecute(sql), 0) << sql; }

// Empties the patrol store and the camera table.
inline void ResetTables() {
    Exec("TRUNCATE patrol, patrol_preset, camera RESTART IDENTITY;");
}

// Runs "scripts/pg_cluster.sh <command> $PTZ_PG_DIR" (restart, down, up).
inline int Cluster(const std::string& command) {
    const char* src = std::getenv("PTZ_SOURCE_DIR");
    const char* dir = std::getenv("PTZ_PG_DIR");
    if (!src || !dir) return -1;
    const std::string cmd = std::string(src) + "/scripts/pg_cluster.sh " + command + " " + dir;
    return std::system(cmd.c_str());
}

}  // namespace pgtest

#endif  // TESTS_COMMON_PG_TEST_UTIL_H
