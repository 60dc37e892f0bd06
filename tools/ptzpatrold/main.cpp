// ptzpatrold: runs the guards of every camera that has weekly schedule
// entries, from the entry in force and the camera's events, and answers a
// status request on 127.0.0.1 (see service.h, README.md).
//
//   ptzpatrold [--listen 127.0.0.1:PORT] [--poll SECONDS] [--camera-timeout MS] [--stderr]
//
// The database comes from the libpq environment (PGHOST, PGDATABASE, ...).
// Logs to the system log as "ptzpatrold" (--stderr: also on stderr). Prints
// "listening on 127.0.0.1:PORT" once it serves (PORT 0: a free one).
// GET /status answers the state of every camera as JSON. SIGTERM or SIGINT
// stop it (exit 0); SIGHUP reads the tables at once. Exit codes: 64 bad
// arguments, 71 the status port cannot be bound.
#include <httplib.h>
#include <pthread.h>
#include <signal.h>
#include <syslog.h>
#include <unistd.h>

#include <CLI/CLI.hpp>
#include <chrono>
#include <cstdio>
#include <thread>

#include "hostlib/camera/onvif_camera.h"
#include "service.h"

namespace {

constexpr int kUsage = 64, kCantListen = 71;
constexpr auto kStep = std::chrono::milliseconds(100);

// "127.0.0.1:PORT" -> PORT; -1 for anything else: the status is served on
// the loopback address only.
int LoopbackPort(const std::string& listen) {
    const std::string prefix = "127.0.0.1:";
    if (listen.compare(0, prefix.size(), prefix) != 0) return -1;
    const std::string port = listen.substr(prefix.size());
    if (port.empty() || port.size() > 5 ||
        port.find_first_not_of("0123456789") != std::string::npos)
        return -1;
    const int value = std::stoi(port);
    return value <= 65535 ? value : -1;
}

}  // namespace

// In a ThreadSanitizer build the process would sleep a second at exit while
// threads still run (the sanitizer's default, to catch races at exit): a stop
// that leaves a call in flight would take that much longer.
extern "C" const char* __tsan_default_options() { return "atexit_sleep_ms=0"; }

int main(int argc, char** argv) {
    CLI::App app{
        "ptzpatrold: runs the guards of the cameras' weekly schedules (guard_schedule) from the "
        "entry in force and the cameras' events.\nThe database comes from the libpq environment "
        "(PGHOST, PGPORT, PGDATABASE, PGUSER, ...)."};
    app.name("ptzpatrold");
    std::string listen = "127.0.0.1:7478";
    ptzd::Options options;
    int timeoutMs = 5000;
    bool toStderr = false;
    app.add_option("--listen", listen, "Status request address, 127.0.0.1:PORT (default 7478)");
    app.add_option("--poll", options.pollSeconds, "Seconds between looks at the tables (default 5)")
        ->check(CLI::Range(1, 3600));
    app.add_option("--camera-timeout", timeoutMs, "Bound of each camera call, in ms (default 5000)")
        ->check(CLI::Range(100, 600000));
    app.add_flag("--stderr", toStderr, "Log on stderr too");
    app.footer("Exit codes: 0 stopped by SIGTERM or SIGINT, 64 bad arguments, 71 cannot listen.");
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        return app.exit(e) == 0 ? 0 : kUsage;
    }
    const int port = LoopbackPort(listen);
    if (port < 0) {
        fprintf(stderr, "ptzpatrold: --listen must be 127.0.0.1:PORT, not '%s'\n", listen.c_str());
        return kUsage;
    }

    // Signals are taken by the main loop alone: every thread started from
    // here on inherits the mask.
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGHUP);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);
    openlog("ptzpatrold", LOG_PID | (toStderr ? LOG_PERROR : 0), LOG_DAEMON);
    onvif::SetCallTimeoutMs(timeoutMs);

    ptzd::Service service(options);
    httplib::Server server;
    server.new_task_queue = [] { return new httplib::ThreadPool(2); };
    server.Get("/status", [&service](const httplib::Request&, httplib::Response& res) {
        res.set_content(
            service.Status().dump(-1, ' ', false, nlohmann::json::error_handler_t::replace) + "\n",
            "application/json");
    });
    const int bound = port == 0 ? server.bind_to_any_port("127.0.0.1")
                                : (server.bind_to_port("127.0.0.1", port) ? port : -1);
    if (bound <= 0) {
        ptzd::Log(LOG_ERR, "cannot listen on %s", listen.c_str());
        fprintf(stderr, "ptzpatrold: cannot listen on %s\n", listen.c_str());
        return kCantListen;
    }
    std::thread http([&server] { server.listen_after_bind(); });
    service.Start();
    printf("listening on 127.0.0.1:%d\n", bound);
    fflush(stdout);
    ptzd::Log(LOG_NOTICE, "started: status on 127.0.0.1:%d, tables read every %d s", bound,
              options.pollSeconds);

    for (;;) {
        struct timespec wait = {0, std::chrono::nanoseconds(kStep).count()};
        const int sig = sigtimedwait(&signals, nullptr, &wait);
        if (sig == SIGTERM || sig == SIGINT) break;
        if (sig == SIGHUP) service.Reload();
        service.Step();
    }
    const auto stopping = std::chrono::steady_clock::now();
    server.stop();
    http.join();
    service.Stop();
    ptzd::Log(LOG_NOTICE, "stopped in %.0f ms",
              std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - stopping)
                  .count());
    // Cameras, guards and executors are stopped; only a read of the tables
    // may still wait for the database, and the process does not.
    if (service.Abandoned()) _exit(0);
    return 0;
}
