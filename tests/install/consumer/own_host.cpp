// A host with its own implementation of the host services (host/*.h), as an
// NVR server has: libptzpatrol resolves them from this program when it is
// loaded. The database here only records statements and hands out ids.
#include <sys/time.h>

#include <cstdio>
#include <string>
#include <vector>

#include "host/camera.h"
#include "host/database.h"
#include "host/http.h"
#include "host/timer.h"
#include "patrol/patrol.h"

namespace {
std::vector<std::string> statements;
}

struct DBResult_tag {
    int fetched = 0;
};
const char* gszTablePatrol = "patrol";
const char* gszTablePatrolPresetData = "patrol_preset";
int OvDBExecute(const std::string& sql, DBResult_tag** result) {
    statements.push_back(sql);
    *result = new DBResult_tag;
    return 0;
}
int OvDBExecute(const std::string& sql) {
    statements.push_back(sql);
    return 0;
}
std::string OvDBEscapeString(const std::string& text) { return text; }
std::string itos(long long value) { return std::to_string(value); }
extern "C" {
int KELODBNumRows(DBResult_tag*) { return 1; }
int KELODBFetchRow(DBResult_tag* r, unsigned int* row) {
    if (r->fetched++ > 0) return -1;
    *row = 0;
    return 0;
}
const char* KELODBFetchField(DBResult_tag*, unsigned int, const char*) { return "42"; }
void KELODBFreeResult(DBResult_tag* r) { delete r; }
}

int Camera::Load(int, int) { return -1; }
CameraAPI* newCameraAPI(const std::string&, int, const std::string&, const std::string&, const std::string&,
                        const std::string&, const std::string&) {
    return nullptr;
}
CameraAPI* newUserDefinedAPI(const std::string&, int, const std::string&, const std::string&,
                             const std::string&, const std::string&) {
    return nullptr;
}
void releaseCameraAPI(CameraAPI* api) { delete api; }
int GetCamConnStatus(int) { return 0; }

struct OvHttpClient::Impl {};
OvHttpClient::OvHttpClient(const std::string&, int, const std::string&, const std::string&,
                           const std::string&, int) {}
OvHttpClient::~OvHttpClient() = default;
int OvHttpClient::SendRequest(OV_HTTP_METHOD) { return -1; }
int OvHttpClient::CheckResponse(int&) { return -1; }
int OvHttpClient::GetHttpContent(HTTP_MAP_KEY, std::string&) { return -1; }
int OvHttpClient::ReadData(char*, int) { return -1; }
struct MultipartFetch::Impl {};
MultipartFetch::MultipartFetch(const char*, int, const char*, const char*, const char*, int) {}
MultipartFetch::~MultipartFetch() = default;
int MultipartFetch::NextPartInfo(unsigned int&, char*, unsigned int) { return -1; }
int MultipartFetch::FetchContent(unsigned char*, unsigned int) { return -1; }

TimeCount::TimeCount() : length_(0), start_(0) {}
void TimeCount::SetCountingTime(unsigned long long microseconds) { length_ = microseconds; }
void TimeCount::BeginCountFromNow() {}
int TimeCount::IsExceed() { return 1; }
DelayTimer::DelayTimer(int period) : period_(period), next_(0) {}
void DelayTimer::BeginTiming() {}
void DelayTimer::Delay() {}
int IsTimeStampValid(struct timeval, int) { return 0; }

int main() {
    Patrol p(7, "own host", 5);
    p.AddPresetToList({1, "door"});
    if (p.Save() != 0 || p.GetId() != 42 || statements.size() != 2 ||
        statements[0].rfind("INSERT INTO patrol ", 0) != 0) {
        std::puts("the library did not run on this program's host services");
        return 1;
    }
    std::printf("own host: patrol %d saved through the program's database layer (%zu calls)\n", p.GetId(),
                statements.size());
    return 0;
}
