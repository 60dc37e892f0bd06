// PostgreSQL database layer on libpq: a pool of connections, statements run
// with PQexec, results kept as PGresult until the caller frees them.
#include "host/database.h"

#include <errno.h>
#include <libpq-fe.h>
#include <poll.h>

#include <atomic>
#include <chrono>
#include <climits>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "hostlib/db/database_config.h"

const char* gszTablePatrol = "patrol";
const char* gszTablePatrolPresetData = "patrol_preset";

struct DBResult_tag {
    PGresult* res;
    int nextRow;
};

namespace {

using Clock = std::chrono::steady_clock;

// How long one statement (or batch) may take, from the wait for a connection
// to its last result. A stalled server must not hold a host thread forever.
std::atomic<int> statementTimeoutMs{15000};

Clock::time_point StatementDeadline() {
    return Clock::now() + std::chrono::milliseconds(statementTimeoutMs.load());
}

struct ConnCloser {
    void operator()(PGconn* c) const { PQfinish(c); }
};
using ConnPtr = std::unique_ptr<PGconn, ConnCloser>;

// Waits until the connection's socket is ready for `events`. False at the
// deadline or on a poll error.
bool WaitSocket(PGconn* conn, short events, Clock::time_point deadline) {
    for (;;) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - Clock::now()).count();
        if (left <= 0) return false;
        struct pollfd pfd = {PQsocket(conn), events, 0};
        const int rc = poll(&pfd, 1, static_cast<int>(left < INT_MAX ? left : INT_MAX));
        if (rc > 0) return true;
        if (rc < 0 && errno != EINTR) return false;
    }
}

// Drives a started connection attempt (connect or reset) to its end by the
// deadline. True when the connection is up.
bool FinishConnect(PGconn* conn, PostgresPollingStatusType (*pollOnce)(PGconn*), Clock::time_point deadline) {
    PostgresPollingStatusType st = PGRES_POLLING_WRITING;
    for (;;) {
        if (st == PGRES_POLLING_OK) return true;
        if (st == PGRES_POLLING_FAILED) return false;
        if (!WaitSocket(conn, st == PGRES_POLLING_READING ? POLLIN : POLLOUT, deadline)) return false;
        st = pollOnce(conn);
    }
}

class Pool {
public:
    // Borrows a working connection, opening one if needed. Null when the
    // server cannot be reached.
    ConnPtr Acquire(Clock::time_point deadline) {
        std::unique_lock<std::mutex> lock(mu_);
        if (!cv_.wait_until(lock, deadline, [&] { return !idle_.empty() || open_ < size_; })) return nullptr;
        ConnPtr conn;
        std::string conninfo = conninfo_;
        if (!idle_.empty()) {
            conn = std::move(idle_.back());
            idle_.pop_back();
        } else {
            ++open_;  // reserve the slot while connecting outside the lock
        }
        const unsigned generation = generation_;
        lock.unlock();

        if (conn && !Healthy(conn.get()) &&
            (PQresetStart(conn.get()) != 1 || !FinishConnect(conn.get(), PQresetPoll, deadline))) {
            conn.reset();
        }
        if (!conn) conn = Connect(conninfo, deadline);
        if (conn && PQstatus(conn.get()) != CONNECTION_OK) conn.reset();
        if (!conn) {
            Release(nullptr, generation);
            return nullptr;
        }
        return conn;
    }

    // Returns a connection (null: the slot is freed).
    void Release(ConnPtr conn, unsigned generation) {
        std::lock_guard<std::mutex> lock(mu_);
        if (conn && generation == generation_ && PQstatus(conn.get()) == CONNECTION_OK &&
            PQtransactionStatus(conn.get()) == PQTRANS_IDLE) {
            idle_.push_back(std::move(conn));
        } else {
            --open_;
            conn.reset();
        }
        cv_.notify_one();
    }

    void SetConnInfo(const std::string& conninfo) {
        std::lock_guard<std::mutex> lock(mu_);
        conninfo_ = conninfo;
        ++generation_;
        open_ -= static_cast<int>(idle_.size());
        idle_.clear();
        cv_.notify_all();
    }

    void SetSize(int size) {
        std::lock_guard<std::mutex> lock(mu_);
        size_ = size < 1 ? 1 : size;
        cv_.notify_all();
    }

    void CloseIdle() {
        std::lock_guard<std::mutex> lock(mu_);
        open_ -= static_cast<int>(idle_.size());
        idle_.clear();
        cv_.notify_all();
    }

    unsigned Generation() {
        std::lock_guard<std::mutex> lock(mu_);
        return generation_;
    }

    std::string ConnInfo() {
        std::lock_guard<std::mutex> lock(mu_);
        return conninfo_;
    }

    // Opens a connection by the deadline. Null only when out of memory; a
    // connection that failed or was not up by the deadline says why in
    // PQerrorMessage, and its status is not CONNECTION_OK.
    static ConnPtr Connect(const std::string& conninfo, Clock::time_point deadline) {
        const char* keys[] = {"dbname", "client_encoding", nullptr};
        const char* values[] = {conninfo.c_str(), "UTF8", nullptr};
        ConnPtr conn(PQconnectStartParams(keys, values, 1));
        if (!conn) return nullptr;
        if (PQstatus(conn.get()) == CONNECTION_BAD || !FinishConnect(conn.get(), PQconnectPoll, deadline)) {
            return conn;
        }
        // Server notices are not the host's business; libpq would print them to stderr.
        PQsetNoticeProcessor(conn.get(), [](void*, const char*) {}, nullptr);
        return conn;
    }

private:
    // An idle connection has nothing to read unless its server sent a
    // termination notice or closed it (restart, shutdown, idle kill): then it
    // is reset before a statement is sent on it.
    static bool Healthy(PGconn* conn) {
        if (PQstatus(conn) != CONNECTION_OK) return false;
        struct pollfd pfd = {PQsocket(conn), POLLIN, 0};
        if (pfd.fd < 0) return false;
        return poll(&pfd, 1, 0) == 0;
    }

    std::mutex mu_;
    std::condition_variable cv_;
    std::vector<ConnPtr> idle_;
    int open_ = 0;
    int size_ = 8;
    unsigned generation_ = 0;
    std::string conninfo_;
};

Pool& ThePool() {
    static Pool* pool = new Pool;  // lives to process exit: statements may run during teardown
    return *pool;
}

// Borrowed connection, returned to the pool on every way out.
class Lease {
public:
    explicit Lease(Clock::time_point deadline)
        : generation_(ThePool().Generation()), conn_(ThePool().Acquire(deadline)) {}
    ~Lease() {
        if (conn_) ThePool().Release(std::move(conn_), generation_);
    }
    Lease(const Lease&) = delete;
    Lease& operator=(const Lease&) = delete;
    PGconn* get() const { return conn_.get(); }

private:
    unsigned generation_;
    ConnPtr conn_;
};

bool IsError(const PGresult* res) {
    const ExecStatusType st = PQresultStatus(res);
    return st != PGRES_TUPLES_OK && st != PGRES_COMMAND_OK;
}

// Sends `sql` and collects its results by the deadline, without blocking
// beyond it: the first error result, else the last result. Null when the
// connection failed or the deadline passed; the connection is then left mid
// query, and the pool drops it when it comes back.
PGresult* ExecBounded(PGconn* conn, const std::string& sql, Clock::time_point deadline) {
    if (PQsetnonblocking(conn, 1) != 0 || PQsendQuery(conn, sql.c_str()) != 1) return nullptr;
    for (;;) {  // a large statement may not fit the socket at once
        const int flushed = PQflush(conn);
        if (flushed == 0) break;
        if (flushed < 0 || !WaitSocket(conn, POLLIN | POLLOUT, deadline) || PQconsumeInput(conn) == 0) {
            return nullptr;
        }
    }
    PGresult* kept = nullptr;
    for (;;) {
        while (PQisBusy(conn)) {
            if (!WaitSocket(conn, POLLIN, deadline) || PQconsumeInput(conn) == 0) {
                PQclear(kept);
                return nullptr;
            }
        }
        PGresult* res = PQgetResult(conn);
        if (res == nullptr) return kept;
        if (kept != nullptr && IsError(kept)) {
            PQclear(res);
        } else {
            PQclear(kept);
            kept = res;
        }
    }
}

// Runs one statement, or several as one transaction; the result on success,
// null on failure.
PGresult* Run(const std::string& sql) {
    const Clock::time_point deadline = StatementDeadline();
    Lease lease(deadline);
    if (!lease.get()) return nullptr;
    PGresult* res = ExecBounded(lease.get(), sql, deadline);
    if (res == nullptr || IsError(res)) {
        PQclear(res);
        return nullptr;
    }
    return res;
}

}  // namespace

void HostDBSetConnInfo(const std::string& conninfo) { ThePool().SetConnInfo(conninfo); }

int HostDBCheck(std::string* where, std::string* error) {
    {
        Lease lease(StatementDeadline());
        if (lease.get()) return 0;
    }
    // The pool gives no reason: one more attempt, kept to read it.
    ConnPtr conn = Pool::Connect(ThePool().ConnInfo(), StatementDeadline());
    if (conn && PQstatus(conn.get()) == CONNECTION_OK) return 0;
    std::string tried, message = conn ? PQerrorMessage(conn.get()) : "out of memory";
    if (message.empty()) message = "no answer within the statement timeout";
    if (conn) {
        const std::string host = PQhost(conn.get()) ? PQhost(conn.get()) : "";
        const std::string port = PQport(conn.get()) ? PQport(conn.get()) : "";
        tried =
            host.empty() || host[0] == '/'
                ? "socket " + (host.empty() ? std::string("(default)") : host) + "/.s.PGSQL." + port
                : "host " + host + " port " + port;
        tried += std::string(", database ") + (PQdb(conn.get()) ? PQdb(conn.get()) : "") +
                 ", user " + (PQuser(conn.get()) ? PQuser(conn.get()) : "");
    }
    // One line: libpq's message may carry a hint on a second line.
    std::string line;
    for (char c : message) {
        if (c == '\n' || c == '\t' || c == '\r') c = ' ';
        if (!(c == ' ' && (line.empty() || line.back() == ' '))) line += c;
    }
    while (!line.empty() && line.back() == ' ') line.pop_back();
    if (where) *where = tried;
    if (error) *error = line;
    return -1;
}
bool HostDBQuery(const std::string& sql, const std::vector<const char*>& columns,
                 std::vector<std::vector<std::string>>* rows) {
    DBResult_tag* result = nullptr;
    if (OvDBExecute(sql, &result) != 0) return false;
    unsigned int row = 0;
    while (KELODBFetchRow(result, &row) == 0) {
        std::vector<std::string> values;
        for (const char* column : columns) {
            const char* v = KELODBFetchField(result, row, column);
            values.push_back(v ? v : "");
        }
        rows->push_back(std::move(values));
    }
    KELODBFreeResult(result);
    return true;
}

void HostDBSetPoolSize(int size) { ThePool().SetSize(size); }
void HostDBSetStatementTimeoutMs(int ms) { statementTimeoutMs = ms > 0 ? ms : 1; }
void HostDBCloseIdle() { ThePool().CloseIdle(); }

int OvDBExecute(const std::string& sql, DBResult_tag** result) {
    if (result == nullptr) return -1;
    PGresult* res = Run(sql);
    if (!res) return -1;
    *result = new (std::nothrow) DBResult_tag{res, 0};
    if (!*result) {
        PQclear(res);
        return -1;
    }
    return 0;
}

// Several statements in one string go to the server as one simple query,
// which runs them as one implicit transaction: the first error aborts it and
// rolls back the statements before it, and a connection lost midway commits
// nothing. PQexec hands back the last result, the error one if any failed.
int OvDBExecute(const std::string& sql) {
    PGresult* res = Run(sql);
    if (!res) return -1;
    PQclear(res);
    return 0;
}

std::string OvDBEscapeString(const std::string& text) {
    std::string out(text.size() * 2 + 1, '\0');
    size_t n;
    {
        Lease lease(StatementDeadline());
        if (lease.get()) {
            int error = 0;
            n = PQescapeStringConn(lease.get(), &out[0], text.data(), text.size(), &error);
        } else {
            // No server to ask: standard-conforming strings, only quotes doubled.
            // A statement built from it cannot run anyway until the server is back.
            n = 0;
            for (char c : text) {
                if (c == '\0') break;
                if (c == '\'') out[n++] = '\'';
                out[n++] = c;
            }
        }
    }
    out.resize(n);
    return out;
}

std::string itos(long long value) { return std::to_string(value); }

extern "C" {

int KELODBNumRows(DBResult_tag* result) { return result ? PQntuples(result->res) : 0; }

int KELODBFetchRow(DBResult_tag* result, unsigned int* row) {
    if (!result || !row || result->nextRow >= PQntuples(result->res)) return -1;
    *row = static_cast<unsigned int>(result->nextRow++);
    return 0;
}

const char* KELODBFetchField(DBResult_tag* result, unsigned int row, const char* column) {
    if (!result || !column) return nullptr;
    if (row >= static_cast<unsigned int>(PQntuples(result->res))) return nullptr;
    // PQfnumber folds an unquoted name to lower case, as the server did.
    const int col = PQfnumber(result->res, column);
    if (col < 0) return nullptr;
    return PQgetvalue(result->res, static_cast<int>(row), col);
}

void KELODBFreeResult(DBResult_tag* result) {
    if (!result) return;
    PQclear(result->res);
    delete result;
}

}  // extern "C"
