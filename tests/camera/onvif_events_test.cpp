// ONVIF event sources against the camera simulator: motion and input seen
// within a second, short pulses, camera dialects, a camera that goes away and
// comes back, subscriptions that fault, expire or run out of slots, and
// prompt stops that give the camera's slots back.
#include "hostlib/camera/onvif_events.h"

#include <gtest/gtest.h>
#include <sys/time.h>

#include <chrono>
#include <functional>
#include <memory>
#include <thread>

#include "support/camsim.h"

namespace {

using namespace std::chrono;
using onvif::EventSource;
using Faults = std::vector<std::pair<std::string, std::string>>;

bool WaitFor(const std::function<bool()>& condition, milliseconds timeout) {
    auto deadline = steady_clock::now() + timeout;
    while (!condition()) {
        if (steady_clock::now() > deadline) return condition();
        std::this_thread::sleep_for(milliseconds(5));
    }
    return true;
}

int64_t WallUs() {
    struct timeval tv;
    gettimeofday(&tv, nullptr);
    return int64_t{tv.tv_sec} * 1000000 + tv.tv_usec;
}

int64_t Us(const struct timeval& tv) { return int64_t{tv.tv_sec} * 1000000 + tv.tv_usec; }

struct Events {
    EVENT_STATUS first, second;
};

Events Read(const EventSource& s) {
    Events e;
    s.Read(&e.first, &e.second);
    return e;
}

// The event is true now: active, stamped now.
bool IsOn(const EVENT_STATUS& e) { return e.active == 1 && Us(e.timestamp) > WallUs() - 500000; }

class OnvifEvents : public ::testing::Test {
protected:
    onvif::EventSourceOptions Options(int port) {
        onvif::EventSourceOptions o;
        o.host = "127.0.0.1";
        o.port = port;
        o.username = "admin";
        o.password = "secret";
        o.pullSeconds = 5;
        o.callTimeoutMs = 2000;
        o.retryMinMs = 50;
        o.retryMaxMs = 200;
        return o;
    }
    std::unique_ptr<EventSource> Source(int port, int pullSeconds = 5) {
        auto o = Options(port);
        o.pullSeconds = pullSeconds;
        return std::make_unique<EventSource>(hub, o);
    }
    // Waits until the source's subscription is live and its Initialized
    // states have been pulled.
    bool Subscribed(const EventSource& s) {
        return WaitFor(
            [&] {
                auto st = s.Status();
                return st.subscribed && st.first.known && st.second.known;
            },
            seconds(5));
    }

    CamSim sim;
    onvif::EventHub hub;
};

TEST_F(OnvifEvents, MotionAndInputReachTheReaderWithinASecond) {
    auto source = Source(sim.Port());
    ASSERT_TRUE(Subscribed(*source));
    EXPECT_EQ(Read(*source).first.active, 0);  // Initialized false is not a fall
    EXPECT_EQ(Read(*source).second.active, 0);
    const uint64_t changes = hub.Changes();

    sim.SetEvents("motion=1");
    EXPECT_TRUE(WaitFor([&] { return IsOn(Read(*source).first); }, milliseconds(1000)));
    EXPECT_TRUE(WaitFor([&] { return hub.Changes() > changes; }, milliseconds(100)));
    EXPECT_EQ(Read(*source).second.active, 0);
    int64_t before = WallUs();
    sim.SetEvents("motion=0");
    // Fallen: still present, stamped with the time of the fall.
    ASSERT_TRUE(WaitFor([&] { return !source->Status().first.value; }, milliseconds(1000)));
    Events e = Read(*source);
    EXPECT_EQ(e.first.active, 1);
    EXPECT_GE(Us(e.first.timestamp), before - 1100000);
    EXPECT_LE(Us(e.first.timestamp), WallUs());

    sim.SetEvents("input=1");
    EXPECT_TRUE(WaitFor([&] { return IsOn(Read(*source).second); }, milliseconds(1000)));
    auto st = source->Status();
    EXPECT_EQ(st.first.alarms, 1u);
    EXPECT_EQ(st.second.alarms, 1u);
    EXPECT_EQ(Read(*source).first.reserved, 1);  // the alarm count
    EXPECT_TRUE(st.reachable);
    EXPECT_EQ(st.subscriptions, 1u);
    EXPECT_EQ(sim.Events().live, 1);
}

TEST_F(OnvifEvents, ShortPulsesAreNotLost) {
    auto source = Source(sim.Port());
    ASSERT_TRUE(Subscribed(*source));
    // Rise and fall in one pull.
    sim.SetEvents("motion=1&motion=0&input=1&input=0");
    ASSERT_TRUE(WaitFor([&] { return source->Status().second.alarms == 1; }, milliseconds(1000)));
    Events e = Read(*source);
    EXPECT_EQ(e.first.active, 1);
    EXPECT_EQ(e.second.active, 1);
    EXPECT_FALSE(source->Status().first.value);
    // Rise and fall in two pulls, the reader looking only afterwards.
    sim.SetEvents("motion=1");
    ASSERT_TRUE(WaitFor([&] { return source->Status().first.alarms == 2; }, milliseconds(1000)));
    sim.SetEvents("motion=0");
    ASSERT_TRUE(WaitFor([&] { return !source->Status().first.value; }, milliseconds(1000)));
    EXPECT_EQ(Read(*source).first.active, 1);
}

TEST_F(OnvifEvents, CameraDialects) {
    for (const Faults& faults : std::vector<Faults>{
             {{"event_soap11", "1"}},
             {{"event_prefixes", "1"}},
             {{"event_cell_motion", "1"}},
             {{"event_ref_params", "1"}},
             {{"internal_address", "10.9.9.9:8080"}},  // behind NAT
             {{"no_get_services", "1"}},
             {{"http_auth_only", "1"}},  // WS-Security ignored: HTTP Digest
             {{"event_grant_s", "3"}},   // shorter than asked: renewed in time
             // The camera's clock is an hour ahead: signed requests and event
             // times follow it.
             {{"clock_skew_s", "3600"}, {"time_auth", "1"}},
         }) {
        sim.ClearFaults();
        for (const auto& f : faults) sim.SetFault(f.first, f.second);
        auto source = Source(sim.Port());
        ASSERT_TRUE(Subscribed(*source)) << faults[0].first << " " << source->Status().lastError;
        auto before = sim.Events();
        sim.SetEvents("motion=1");
        EXPECT_TRUE(WaitFor([&] { return IsOn(Read(*source).first); }, milliseconds(1000)))
            << faults[0].first;
        int64_t fall = WallUs();
        sim.SetEvents("motion=0");
        EXPECT_TRUE(WaitFor([&] { return !source->Status().first.value; }, milliseconds(1000)));
        Events e = Read(*source);
        EXPECT_EQ(e.first.active, 1) << faults[0].first;
        EXPECT_NEAR(Us(e.first.timestamp), fall, 1500000) << faults[0].first;
        if (faults[0].first == "event_grant_s") {
            EXPECT_TRUE(
                WaitFor([&] { return sim.Events().renewed >= before.renewed + 2; }, seconds(5)));
            EXPECT_EQ(sim.Events().created, before.created)
                << source->Status().lastError;  // it never expired
        }
        source.reset();
        EXPECT_TRUE(WaitFor([&] { return sim.Events().live == 0; }, seconds(2))) << faults[0].first;
    }
}

TEST_F(OnvifEvents, LostSubscriptionsAreReplacedWithoutLeakingSlots) {
    sim.SetFault("event_slots", "2");
    auto source = Source(sim.Port(), 1);  // a pull fault is met within a second
    ASSERT_TRUE(Subscribed(*source));
    sim.SetEvents("motion=1");
    ASSERT_TRUE(WaitFor([&] { return IsOn(Read(*source).first); }, milliseconds(1000)));
    // A pull fault, the camera forgetting its subscriptions: each time the
    // source subscribes again (giving the old one back) and learns the
    // current states from Initialized messages, which are no new alarms.
    for (int round = 0; round < 3; ++round) {
        if (round == 2) {
            sim.DropSubscriptions();
        } else {
            sim.SetFault("pull_fault", "1");
        }
        ASSERT_TRUE(
            WaitFor([&] { return source->Status().subscriptions == 2u + round; }, seconds(5)));
        ASSERT_TRUE(Subscribed(*source));
        EXPECT_TRUE(IsOn(Read(*source).first));
        EXPECT_EQ(source->Status().first.alarms, 1u);
        EXPECT_EQ(sim.Events().live, 1);
    }
    EXPECT_EQ(sim.Events().created, 4);
    // The slots are full: a second source fails, reads nothing and says why.
    sim.SetFault("event_slots", "1");
    auto other = Source(sim.Port());
    EXPECT_TRUE(WaitFor([&] { return !other->Status().lastError.empty(); }, seconds(5)));
    EXPECT_NE(other->Status().lastError.find("TooManySubscriptions"), std::string::npos)
        << other->Status().lastError;
    EXPECT_FALSE(other->Status().subscribed);
    EXPECT_EQ(Read(*other).first.active, 0);
}

TEST_F(OnvifEvents, CameraGoneAndBack) {
    auto camera = std::make_unique<CamSim>();
    const int port = camera->Port();
    auto source = Source(port);
    ASSERT_TRUE(Subscribed(*source));
    camera->SetEvents("motion=1");
    ASSERT_TRUE(WaitFor([&] { return IsOn(Read(*source).first); }, milliseconds(1000)));
    camera.reset();
    // Absent while the camera does not answer.
    EXPECT_TRUE(WaitFor([&] { return Read(*source).first.active == 0; }, seconds(2)));
    EXPECT_FALSE(source->Status().reachable);
    EXPECT_FALSE(source->Status().subscribed);

    CamSim::Options o;
    o.port = port;
    camera = std::make_unique<CamSim>(o);
    camera->SetEvents("motion=1&input=1");
    ASSERT_TRUE(Subscribed(*source));
    EXPECT_TRUE(WaitFor([&] { return IsOn(Read(*source).second); }, seconds(2)));
    EXPECT_TRUE(IsOn(Read(*source).first));
    EXPECT_EQ(source->Status().first.alarms, 1u);  // Initialized true is no alarm
    EXPECT_EQ(camera->Events().live, 1);
}

TEST_F(OnvifEvents, WrongPasswordIsReportedAndReadsAbsent) {
    auto o = Options(sim.Port());
    o.password = "wrong";
    EventSource source(hub, o);
    sim.SetEvents("motion=1");
    EXPECT_TRUE(WaitFor([&] { return !source.Status().lastError.empty(); }, seconds(5)));
    EXPECT_NE(source.Status().lastError.find("NotAuthorized"), std::string::npos)
        << source.Status().lastError;
    EXPECT_TRUE(source.Status().reachable);
    EXPECT_EQ(Read(source).first.active, 0);
}

TEST_F(OnvifEvents, StopsArePromptAndGiveTheSlotsBack) {
    CamSim::Options big;
    big.threads = 64;  // a thread per connection: 24 pulls, then 24 Unsubscribes
    CamSim many(big);
    many.SetFault("event_slots", "100");
    std::vector<std::unique_ptr<EventSource>> sources;
    for (int i = 0; i < 24; ++i) {
        auto o = Options(many.Port());
        o.pullSeconds = 30;  // every source waits in a long poll
        sources.push_back(std::make_unique<EventSource>(hub, o));
    }
    for (auto& s : sources) ASSERT_TRUE(Subscribed(*s));
    ASSERT_TRUE(WaitFor([&] { return many.Events().pulls >= 24; }, seconds(5)));
    auto start = steady_clock::now();
    sources.clear();
    EXPECT_LT(steady_clock::now() - start, milliseconds(1000));
    EXPECT_TRUE(WaitFor([&] { return many.Events().live == 0; }, seconds(2)));
    EXPECT_EQ(many.Events().unsubscribed, 24);
}

}  // namespace
