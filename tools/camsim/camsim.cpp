// camsim: a PTZ network camera on 127.0.0.1 for tests and checks.
//
//   camsim [--port N] [--user U] [--password P] [--preset TOKEN=NAME]...
//          [--snapshot-stream] [--threads N] [--exit-on-stdin-eof]
//
// Prints "CAMSIM_PORT=<port>" on stdout once it listens (port 0, the default,
// picks a free one). Without --preset it has presets 1 Home, 2 Door, 5 Gate,
// 9 Yard. --threads: connections served at once (default 32; each keep-alive
// connection, and so each waiting event pull, holds one). Serves, with HTTP
// Digest auth (SOAP also takes WS-Security):
//   POST /onvif/device_service, /onvif/media_service, /onvif/ptz_service  ONVIF
//   POST /onvif/event_service, /onvif/events/subscription/...  events (camsim_events.h)
//   GET  /snapshot.jpg?profile=P   JPEG filled with the colour of the current preset
//   GET  /mjpeg?profile=P&frames=N multipart/x-mixed-replace, 10 frames a second
// and, without auth, the control endpoints for tests:
//   GET  /control/ping | presets | moves | now | current | requests (count, control aside)
//        (moves: "token<TAB>seconds since start<TAB>CLOCK_MONOTONIC seconds" lines)
//   POST /control/presets (lines "token<TAB>name"), /control/moves/clear,
//        /control/fault ("name=value"; empty value clears), /control/faults/clear
// Faults: delay_ms, status, refuse, snapshot_delivery (length|chunked|close),
// drop_mid_body, lie_length (Content-Length twice the body, then close),
// garbage (SOAP replies that are not XML), fault_http_status (status of SOAP
// faults), http_auth_only (WS-Security ignored, HTTP Digest required),
// time_auth (GetSystemDateAndTime needs credentials), time_no_utc,
// clock_skew_s, no_get_services, no_get_capabilities, alt_paths
// (/onvif/Media, /onvif/PTZ), internal_address ("host:port" reported in
// service and snapshot addresses, as a camera behind NAT does), trickle_ms
// (the image, or stream frame trickle_frame (default 0), declares a
// Content-Length of 100000 and then sends one byte every trickle_ms ms),
// snapshot_stream (GetSnapshotUri gives the MJPEG stream, 20 frames; set from
// the start by --snapshot-stream).
// GotoPreset carries only a token; every one received is logged on stderr
// (unless the environment has CAMSIM_QUIET).
#include "camsim.h"

#include <arpa/inet.h>
#include <httplib.h>
#include <netinet/in.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <memory>
#include <random>
#include <sstream>
#include <thread>

#include "camsim_events.h"

namespace camsim {

std::string State::Fault(const std::string& name) {
    std::lock_guard<std::mutex> lock(mu);
    auto it = faults.find(name);
    return it == faults.end() ? std::string() : it->second;
}

double State::Now() const {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

namespace {

const char* kBoundary = "camsimframe";
const size_t kTrickleBytes = 100000;

// Milliseconds between the bytes of a trickled body; 0 when not trickling.
long TrickleMs(State& state) {
    return std::max(0L, std::min(atol(state.Fault("trickle_ms").c_str()), 10000L));
}

// Sends `count` bytes one at a time, `ms` apart; false once the client is gone.
bool Trickle(httplib::DataSink& sink, size_t count, long ms) {
    for (size_t i = 0; i < count; ++i) {
        if (i > 0) std::this_thread::sleep_for(std::chrono::milliseconds(ms));
        char byte = static_cast<char>(i & 0xff);
        if (!sink.is_writable() || !sink.write(&byte, 1)) return false;
    }
    return true;
}

int gThreads = 32;

bool IsControl(const std::string& path) { return path.rfind("/control/", 0) == 0; }

std::map<std::string, std::string> ParseDigest(const std::string& header) {
    std::map<std::string, std::string> out;
    size_t i = header.find(' ');
    while (i != std::string::npos && i < header.size()) {
        while (i < header.size() && (header[i] == ' ' || header[i] == ',')) ++i;
        size_t eq = header.find('=', i);
        if (eq == std::string::npos) break;
        std::string key = header.substr(i, eq - i);
        std::string value;
        i = eq + 1;
        if (i < header.size() && header[i] == '"') {
            size_t end = header.find('"', i + 1);
            if (end == std::string::npos) break;
            value = header.substr(i + 1, end - i - 1);
            i = end + 1;
        } else {
            size_t end = header.find(',', i);
            value = header.substr(i, end == std::string::npos ? std::string::npos : end - i);
            i = end;
        }
        out[key] = value;
    }
    return out;
}

bool DigestOk(State& state, const httplib::Request& req) {
    std::string header = req.get_header_value("Authorization");
    if (header.rfind("Digest ", 0) != 0) return false;
    auto p = ParseDigest(header);
    std::string user, password;
    {
        std::lock_guard<std::mutex> lock(state.mu);
        user = state.user;
        password = state.password;
    }
    if (p["username"] != user || p["nonce"].empty()) return false;
    std::string ha1 = Md5Hex(user + ":" + p["realm"] + ":" + password);
    std::string ha2 = Md5Hex(req.method + ":" + p["uri"]);
    std::string expected = p["qop"].empty() ? Md5Hex(ha1 + ":" + p["nonce"] + ":" + ha2)
                                            : Md5Hex(ha1 + ":" + p["nonce"] + ":" + p["nc"] + ":" +
                                                     p["cnonce"] + ":" + p["qop"] + ":" + ha2);
    return expected == p["response"];
}

void Challenge(httplib::Response& res) {
    static std::mutex mu;
    static std::mt19937_64 rng(std::random_device{}());
    char nonce[40];
    {
        std::lock_guard<std::mutex> lock(mu);
        snprintf(nonce, sizeof nonce, "%016llx%016llx", static_cast<unsigned long long>(rng()),
                 static_cast<unsigned long long>(rng()));
    }
    res.status = 401;
    res.set_header("WWW-Authenticate",
                   std::string("Digest realm=\"camsim\", qop=\"auth\", nonce=\"") + nonce +
                       "\", algorithm=MD5");
    res.set_content("Unauthorized\n", "text/plain");
}

// Sends `body` the way the faults and `delivery` say.
void SendBody(State& state, httplib::Response& res, int status, const std::string& body,
              const std::string& type, const std::string& delivery) {
    res.status = status;
    bool drop = state.Fault("drop_mid_body") == "1";
    bool lie = state.Fault("lie_length") == "1";
    auto data = std::make_shared<std::string>(body);
    size_t sent = drop ? data->size() / 2 : data->size();
    if (delivery == "chunked" || delivery == "close") {
        bool chunked = delivery == "chunked";
        auto provider = [data, sent, drop, chunked](size_t, httplib::DataSink& sink) {
            for (size_t off = 0; off < sent; off += 1024)
                if (!sink.write(data->data() + off, std::min<size_t>(1024, sent - off)))
                    return false;
            if (drop) return false;
            // Without a length the end of the body is the close; the server
            // library would keep the connection open after done(), so the
            // provider reports an error to make it close.
            if (!chunked) return false;
            sink.done();
            return true;
        };
        if (delivery == "chunked") {
            res.set_chunked_content_provider(type, provider);
        } else {
            res.set_header("Connection", "close");
            res.set_content_provider(type, provider);
        }
        return;
    }
    if (!drop && !lie) {
        res.set_content(body, type);
        return;
    }
    size_t declared = lie ? data->size() * 2 : data->size();
    res.set_content_provider(declared, type,
                             [data, sent](size_t offset, size_t, httplib::DataSink& sink) {
                                 if (offset == 0 && !sink.write(data->data(), sent)) return false;
                                 return false;  // what is left is never sent: close
                             });
}

std::string CurrentToken(State& state) {
    std::lock_guard<std::mutex> lock(state.mu);
    return state.current;
}

void Serve(State& state, httplib::Server& svr) {
    svr.new_task_queue = [] { return new httplib::ThreadPool(gThreads); };
    // Headers and body go out in separate writes; without this, Nagle and the
    // client's delayed ACK add ~40 ms to every reply.
    svr.set_tcp_nodelay(true);

    svr.set_pre_routing_handler([&state](const httplib::Request& req, httplib::Response& res) {
        if (IsControl(req.path)) return httplib::Server::HandlerResponse::Unhandled;
        {
            std::lock_guard<std::mutex> lock(state.mu);
            ++state.requests;
        }
        long delay = atol(state.Fault("delay_ms").c_str());
        if (delay > 0)
            std::this_thread::sleep_for(std::chrono::milliseconds(std::min(delay, 60000L)));
        int status = atoi(state.Fault("status").c_str());
        if (status > 0) {
            res.status = status;
            res.set_content("camsim: injected status\n", "text/plain");
            return httplib::Server::HandlerResponse::Handled;
        }
        return httplib::Server::HandlerResponse::Unhandled;
    });

    svr.Post(R"(/onvif/.*)", [&state](const httplib::Request& req, httplib::Response& res) {
        std::string service = ServiceOfPath(state, req.path);
        if (service.empty()) {
            res.status = 404;
            return;
        }
        SoapReply reply = HandleSoap(state, service, req.body, DigestOk(state, req));
        if (reply.challenge) return Challenge(res);
        SendBody(state, res, reply.status, reply.body, "application/soap+xml; charset=utf-8",
                 "length");
    });

    svr.Get("/snapshot.jpg", [&state](const httplib::Request& req, httplib::Response& res) {
        if (!DigestOk(state, req)) return Challenge(res);
        if (long ms = TrickleMs(state)) {
            res.set_content_provider(kTrickleBytes, "image/jpeg",
                                     [ms](size_t offset, size_t length, httplib::DataSink& sink) {
                                         return offset == 0 && Trickle(sink, length, ms);
                                     });
            return;
        }
        std::string delivery = state.Fault("snapshot_delivery");
        SendBody(state, res, 200, PresetJpeg(CurrentToken(state), 160, 90), "image/jpeg",
                 delivery.empty() ? "length" : delivery);
    });

    svr.Get("/mjpeg", [&state](const httplib::Request& req, httplib::Response& res) {
        if (!DigestOk(state, req)) return Challenge(res);
        int frames = req.has_param("frames") ? atoi(req.get_param_value("frames").c_str()) : 50;
        frames = std::max(1, std::min(frames, 600));
        bool drop = state.Fault("drop_mid_body") == "1";
        long trickleMs = TrickleMs(state);
        int trickleFrame = atoi(state.Fault("trickle_frame").c_str());
        State* s = &state;
        res.set_header("Connection", "close");
        res.set_content_provider(
            std::string("multipart/x-mixed-replace; boundary=") + kBoundary,
            [s, frames, drop, trickleMs, trickleFrame](size_t, httplib::DataSink& sink) {
                for (int i = 0; i < frames; ++i) {
                    if (i > 0) std::this_thread::sleep_for(std::chrono::milliseconds(100));
                    if (trickleMs > 0 && i == trickleFrame) {
                        std::string head = std::string("--") + kBoundary +
                                           "\r\nContent-Type: image/jpeg\r\nContent-Length: " +
                                           std::to_string(kTrickleBytes) + "\r\n\r\n";
                        if (!sink.write(head.data(), head.size())) return false;
                        if (!Trickle(sink, kTrickleBytes, trickleMs)) return false;
                        continue;
                    }
                    std::string jpeg = PresetJpeg(CurrentToken(*s), 160, 90);
                    // Even frames carry a Content-Length, odd ones only the boundary.
                    std::string part =
                        std::string("--") + kBoundary + "\r\nContent-Type: image/jpeg\r\n";
                    if (i % 2 == 0)
                        part += "Content-Length: " + std::to_string(jpeg.size()) + "\r\n";
                    part += "\r\n" + jpeg + "\r\n";
                    size_t n = (drop && i == 1) ? part.size() / 2 : part.size();
                    if (!sink.is_writable() || !sink.write(part.data(), n)) return false;
                    if (drop && i == 1) return false;
                }
                std::string end = std::string("--") + kBoundary + "--\r\n";
                sink.write(end.data(), end.size());
                return false;  // close the connection: the stream has no length
            });
    });

    svr.Get("/control/ping", [](const httplib::Request&, httplib::Response& res) {
        res.set_content("ok\n", "text/plain");
    });
    svr.Get("/control/presets", [&state](const httplib::Request&, httplib::Response& res) {
        std::string out;
        std::lock_guard<std::mutex> lock(state.mu);
        for (const Preset& p : state.presets) out += p.token + "\t" + p.name + "\n";
        res.set_content(out, "text/plain");
    });
    svr.Post("/control/presets", [&state](const httplib::Request& req, httplib::Response& res) {
        std::vector<Preset> presets;
        std::istringstream in(req.body);
        std::string line;
        while (std::getline(in, line)) {
            if (line.empty()) continue;
            size_t tab = line.find('\t');
            presets.push_back({line.substr(0, tab),
                               tab == std::string::npos ? std::string() : line.substr(tab + 1)});
        }
        std::lock_guard<std::mutex> lock(state.mu);
        state.presets = presets;
        res.set_content("ok\n", "text/plain");
    });
    svr.Get("/control/moves", [&state](const httplib::Request&, httplib::Response& res) {
        std::string out;
        std::lock_guard<std::mutex> lock(state.mu);
        // token, seconds since start, and the same moment on the system's
        // monotonic clock (to compare with other processes' times)
        const double origin =
            std::chrono::duration<double>(state.start.time_since_epoch()).count();
        for (const Move& m : state.moves) {
            char t[80];
            snprintf(t, sizeof t, "%.6f\t%.6f", m.seconds, origin + m.seconds);
            out += m.token + "\t" + t + "\n";
        }
        res.set_content(out, "text/plain");
    });
    svr.Post("/control/moves/clear", [&state](const httplib::Request&, httplib::Response& res) {
        std::lock_guard<std::mutex> lock(state.mu);
        state.moves.clear();
        res.set_content("ok\n", "text/plain");
    });
    svr.Get("/control/now", [&state](const httplib::Request&, httplib::Response& res) {
        char t[40];
        snprintf(t, sizeof t, "%.6f\n", state.Now());
        res.set_content(t, "text/plain");
    });
    svr.Get("/control/requests", [&state](const httplib::Request&, httplib::Response& res) {
        std::lock_guard<std::mutex> lock(state.mu);
        res.set_content(std::to_string(state.requests) + "\n", "text/plain");
    });
    svr.Get("/control/current", [&state](const httplib::Request&, httplib::Response& res) {
        res.set_content(CurrentToken(state) + "\n", "text/plain");
    });
    svr.Post("/control/fault", [&state](const httplib::Request& req, httplib::Response& res) {
        size_t eq = req.body.find('=');
        if (eq == std::string::npos) {
            res.status = 400;
            return;
        }
        std::string name = req.body.substr(0, eq), value = req.body.substr(eq + 1);
        while (!value.empty() && (value.back() == '\n' || value.back() == '\r')) value.pop_back();
        std::lock_guard<std::mutex> lock(state.mu);
        if (value.empty())
            state.faults.erase(name);
        else
            state.faults[name] = value;
        res.set_content("ok\n", "text/plain");
    });
    svr.Post("/control/faults/clear", [&state](const httplib::Request&, httplib::Response& res) {
        std::lock_guard<std::mutex> lock(state.mu);
        state.faults.clear();
        res.set_content("ok\n", "text/plain");
    });
    ServeEventControls(state, svr);
}

// The server library listens with a backlog of 5: many clients connecting
// at once (the event tests and benchmark) would see their SYNs dropped and
// retried a second later. listen() again on the bound socket raises it.
void RaiseBacklog(int port) {
    for (int fd = 3; fd < 1024; ++fd) {
        struct sockaddr_in a;
        socklen_t len = sizeof a;
        int listening = 0;
        socklen_t optlen = sizeof listening;
        if (getsockname(fd, reinterpret_cast<struct sockaddr*>(&a), &len) != 0 ||
            a.sin_family != AF_INET || ntohs(a.sin_port) != port ||
            getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &listening, &optlen) != 0 || !listening)
            continue;
        listen(fd, 1024);
    }
}

void Usage() {
    fprintf(stderr,
            "usage: camsim [--port N] [--user U] [--password P] [--preset TOKEN=NAME]... "
            "[--snapshot-stream] [--threads N] [--exit-on-stdin-eof]\n");
    exit(2);
}

}  // namespace
}  // namespace camsim

// In a ThreadSanitizer build the simulator would sleep a second at exit (the
// sanitizer's default, to catch races at exit), and every test that stops one
// would wait for it.
extern "C" const char* __tsan_default_options() { return "atexit_sleep_ms=0"; }

int main(int argc, char** argv) {
    camsim::State state;
    int port = 0;
    bool exitOnEof = false;
    bool presetsGiven = false;
    for (int i = 1; i < argc; ++i) {
        std::string a = argv[i];
        auto next = [&]() -> std::string {
            if (i + 1 >= argc) camsim::Usage();
            return argv[++i];
        };
        if (a == "--port") {
            port = atoi(next().c_str());
        } else if (a == "--user") {
            state.user = next();
        } else if (a == "--password") {
            state.password = next();
        } else if (a == "--preset") {
            std::string p = next();
            size_t eq = p.find('=');
            state.presets.push_back(
                {p.substr(0, eq), eq == std::string::npos ? std::string() : p.substr(eq + 1)});
            presetsGiven = true;
        } else if (a == "--snapshot-stream") {
            state.faults["snapshot_stream"] = "1";
        } else if (a == "--threads") {
            camsim::gThreads = std::max(1, std::min(atoi(next().c_str()), 4096));
        } else if (a == "--exit-on-stdin-eof") {
            exitOnEof = true;
        } else {
            camsim::Usage();
        }
    }
    if (!presetsGiven) state.presets = {{"1", "Home"}, {"2", "Door"}, {"5", "Gate"}, {"9", "Yard"}};

    // SIGTERM and SIGINT end the process at once from a thread of ours; the
    // server keeps no state worth saving.
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGTERM);
    sigaddset(&set, SIGINT);
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
    signal(SIGPIPE, SIG_IGN);
    std::thread([set]() {
        int sig = 0;
        sigwait(&set, &sig);
        fflush(stderr);
        _exit(0);
    }).detach();
    if (exitOnEof)
        std::thread([]() {
            char buf[64];
            while (true) {
                ssize_t n = read(0, buf, sizeof buf);
                if (n == 0 || (n < 0 && errno != EINTR)) break;
            }
            fflush(stderr);
            _exit(0);
        }).detach();

    httplib::Server svr;
    camsim::Serve(state, svr);
    if (port == 0) {
        port = svr.bind_to_any_port("127.0.0.1");
    } else if (!svr.bind_to_port("127.0.0.1", port)) {
        port = -1;
    }
    if (port <= 0) {
        fprintf(stderr, "camsim: cannot listen on 127.0.0.1\n");
        return 1;
    }
    {
        std::lock_guard<std::mutex> lock(state.mu);
        state.port = port;
    }
    camsim::RaiseBacklog(port);
    printf("CAMSIM_PORT=%d\n", port);
    fflush(stdout);
    svr.listen_after_bind();
    fflush(stderr);
    _exit(0);
}
