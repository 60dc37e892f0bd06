// Database services the library takes from the host.
//
// The library builds whole PostgreSQL statements and hands them over; it never
// talks to the server itself. Every function here may be called from several
// threads at once.
#ifndef HOST_DATABASE_H
#define HOST_DATABASE_H

#include <string>

// Opaque result of a statement. The caller that obtained it releases it with
// KELODBFreeResult; nothing keeps a result across calls.
struct DBResult_tag;

// Runs one statement and keeps its rows. 0: success, *result holds the rows
// (release them with KELODBFreeResult). Non-zero: failure, *result untouched.
int OvDBExecute(const std::string& sql, DBResult_tag** result);

// Runs statements whose rows are not wanted: one statement, or several, each
// ending in ";" (one per line), which must run as ONE transaction: either
// every statement takes effect or none does, also when the connection or the
// server goes away in the middle, and other sessions see none of the changes
// before all of them. libpq's PQexec runs a string of several statements
// without BEGIN/COMMIT in this way. The library rewrites a patrol's presets
// with such a batch. 0: success (all committed), non-zero: failure (nothing
// committed).
int OvDBExecute(const std::string& sql);

// Escapes text so that it can stand between single quotes in a statement.
std::string OvDBEscapeString(const std::string& text);

// Decimal text of an integer.
std::string itos(long long value);

// Names of the patrol table and the patrol-preset table, read at each statement.
extern const char* gszTablePatrol;
extern const char* gszTablePatrolPresetData;

extern "C" {
// Number of rows of a result (0 for a null result).
int KELODBNumRows(DBResult_tag* result);

// Moves to the next row, in the result's order, and stores its number in *row
// (0 for the first). 0: a row was fetched; non-zero: no more rows.
int KELODBFetchRow(DBResult_tag* result, unsigned int* row);

// Text of a field, numbers in decimal. The column is named as the statement
// spells it ("camId" finds the server's "camid"). Null when the result has no
// such column or row; callers take a null text as 0 or as an empty name. The
// text lives as long as the result.
const char* KELODBFetchField(DBResult_tag* result, unsigned int row, const char* column);

// Releases a result; a null handle is accepted and ignored.
void KELODBFreeResult(DBResult_tag* result);
}

#endif  // HOST_DATABASE_H
