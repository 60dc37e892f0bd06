// Sets the environment the tests rely on, before main, unless the caller set it.
#include <stdlib.h>

namespace {

struct TestEnvironment {
    TestEnvironment() {
        setenv("PGHOST", PTZ_TEST_PG_DIR, 0);
        setenv("PGUSER", "ptz", 0);
        setenv("PGDATABASE", "ptztest", 0);
        setenv("PTZ_PG_DIR", PTZ_TEST_PG_DIR, 0);
        setenv("PTZ_SOURCE_DIR", PTZ_TEST_SOURCE_DIR, 0);
        setenv("PTZ_BINARY_DIR", PTZ_TEST_BINARY_DIR, 0);
    }
};

const TestEnvironment environment;

}  // namespace
