// PostgreSQL database layer (placeholder until the libpq implementation lands).
#include "host/database.h"

const char* gszTablePatrol = "patrol";
const char* gszTablePatrolPresetData = "patrol_preset";

int OvDBExecute(const std::string&, DBResult_tag**) { return -1; }
int OvDBExecute(const std::string&) { return -1; }
std::string OvDBEscapeString(const std::string& text) { return text; }
std::string itos(long long value) { return std::to_string(value); }

extern "C" {
int KELODBNumRows(DBResult_tag*) { return 0; }
int KELODBFetchRow(DBResult_tag*, unsigned int*) { return -1; }
const char* KELODBFetchField(DBResult_tag*, unsigned int, const char*) { return nullptr; }
void KELODBFreeResult(DBResult_tag*) {}
}
