// Settings of the PostgreSQL database layer (host/database.h).
//
// Connections: a small pool shared by all threads. A statement borrows one
// connection for the time of its execution and returns it; results are kept
// apart from the connection, so a result never ties up a connection. Up to
// the pool size, connections are opened on demand; beyond it a statement waits
// for one to come back.
//
// Connection settings come from the standard libpq environment (PGHOST,
// PGPORT, PGDATABASE, PGUSER, PGPASSWORD, PGSSLMODE, ...) unless the host sets
// a conninfo string first. Every connection uses client_encoding UTF8.
//
// A broken connection (the server restarted or dropped it) is found before a
// statement is sent and reset then, so the next statement works once the
// server is back. A statement whose connection breaks while it runs fails and
// is not sent again. Several statements in one string run as one
// transaction: a connection lost midway commits none of them.
//
// Every statement is bounded in time: from the wait for a free connection to
// its last result it may take the statement timeout (15 s by default), and
// fails when the server does not answer by then (a stalled or unreachable
// server never holds a host thread). Its connection is then closed. A
// statement given up this way may still complete on the server if it resumes
// (a transaction commits whole or not at all).
#ifndef HOSTLIB_DATABASE_CONFIG_H
#define HOSTLIB_DATABASE_CONFIG_H

#include <string>
#include <vector>

// Sets the libpq conninfo string ("host=/run/pg dbname=nvr" or a URI) for
// connections opened from now on, and closes the idle ones. Empty: environment only.
void HostDBSetConnInfo(const std::string& conninfo);

// Sets the most connections open at once (at least 1; default 8).
void HostDBSetPoolSize(int size);

// Sets how long one statement may take in all, in milliseconds (default 15000).
void HostDBSetStatementTimeoutMs(int ms);

// Closes every idle connection (connections in use close when returned).
void HostDBCloseIdle();

// Whether the database can be reached with the settings in force: takes a
// connection of the pool (opening one if none is idle) and gives it back, so
// the check also warms the pool. 0: connected. -1: `where` names what was
// tried, as "socket /run/postgresql/.s.PGSQL.5432" or "host db port 5432",
// followed by ", database D, user U"; `error` holds libpq's message on one
// line. Either pointer may be null.
int HostDBCheck(std::string* where, std::string* error);

// For the host's own queries (our tools): runs `sql` and appends each row's
// values of `columns` as text ("" for SQL NULL) to *rows. False when the
// statement failed.
bool HostDBQuery(const std::string& sql, const std::vector<const char*>& columns,
                 std::vector<std::vector<std::string>>* rows);

#endif  // HOSTLIB_DATABASE_CONFIG_H
