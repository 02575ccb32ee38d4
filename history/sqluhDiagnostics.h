// What every source of the library needs: the texts and records of the diagnostic log, and the
// handling of codes.
//
// A record carries the name of the public operation that failed, wherever in it that was found: a
// helper is handed the name. A null name logs nothing.
#pragma once

#include "history/sqluhist.h"
#include "sqo/sqlpd.h"

// Texts of the log records, letter for letter what administrators' tools look for.
#define TEXT_HEADER_READ "Error reading history header."
#define TEXT_HEADER_PARTIAL "Error reading history header: partial header found."
#define TEXT_HEADER_FAILED "Failed to read from history file.\n"
#define TEXT_ENTRY_READ "Error reading history entry."
#define TEXT_ENTRY_PARTIAL "Error reading history entry: partial entry found."
#define TEXT_ENTRY_FIELDS "Error parsing history entry: invalid number of fields found."
#define TEXT_ENTRY_FIELDS_READ "Number of fields read: "
#define TEXT_ENTRY_LENGTHS "Error parsing history entry: invalid section lengths found."
#define TEXT_BODY_READ "Error reading history entry body."
#define TEXT_BODY_PARTIAL "Error reading history entry body: partial body found."
#define TEXT_ENTRY_CHECKSUM "Error verifying checksum of history entry. Expected: "
#define TEXT_ENTRY_OBSERVED "Observed: "
#define TEXT_ENTRY_OFFSET "Error reading history entry at file offset %lld.\n"
#define TEXT_ENTRY_DUMP "History File Entry"
#define TEXT_ENTRY_SIZE "Actual entry size: %d   Size field: %d.\n"
#define TEXT_VERIFY_FILE "Error encountered in verifying the file:"
#define TEXT_VERIFY_HANDLE "Error encountered in verifying the history file."
#define TEXT_NOT_IDENTICAL                                                                         \
    "History files are not indentical.  Recovering shadow history file\nfrom main history file."
#define TEXT_NOT_USEABLE "History files are not useable.\nrc = %d.\n"
#define TEXT_FILE_SIZE "File size"
#define TEXT_FILE_CHECKSUM "File header checksum"

static inline pdItem textItem(const char* text)
{
    return {pdKindText, text, 0, nullptr, 0};
}

static inline pdItem codeItem(const char* label, int rc)
{
    return {pdKindCode, label, rc, nullptr, 0};
}

static inline pdItem numberItem(const char* label, int64_t number)
{
    return {pdKindNumber, label, number, nullptr, 0};
}

static inline pdItem dataItem(const char* label, const void* data, size_t size)
{
    return {pdKindData, label, 0, data, size};
}

template <unsigned int count>
static inline void logRecord(const pdItem (&items)[count],
                             const char* operation = __builtin_FUNCTION())
{
    if (operation != nullptr)
        pdLog(operation, pdLevelError, items, count);
}

// Logs a code that is not 0 under a label, and hands it back.
static inline int loggedAs(const char* label, int rc, const char* operation)
{
    if (rc != 0 && operation != nullptr) {
        logRecord({codeItem(label, rc)}, operation);
        sqltError(operation, rc);
    }
    return rc;
}

// Logs a code that is not 0 with the label of a failed call, or without one, and hands it back.
static inline int logged(int rc, const char* operation = __builtin_FUNCTION())
{
    return loggedAs("rc = ", rc, operation);
}
static inline int loggedPlain(int rc, const char* operation = __builtin_FUNCTION())
{
    return loggedAs("", rc, operation);
}

// The first failure wins: a later code counts only when nothing failed before.
static inline int firstOf(int rc, int later)
{
    return rc != 0 ? rc : later;
}

// The engine's code for a failed or short transfer; never 0, so that none passes for a success.
static inline int transferCode(int rc)
{
    int mapped = sqlzGetZRCInfo(rc);
    return mapped != 0 ? mapped : HISTORY_FILE_DAMAGED;
}

// 0 for the code of an open that may create, when the file was there before: it is open all the
// same.
static inline int createdCode(int rc)
{
    return rc == sqloFileExisted ? 0 : rc;
}

// Allocates size zero-filled bytes, with the place of the request.
static inline int allocateZeroed(size_t size, void** block, const char* file = __builtin_FILE(),
                                 unsigned int line = __builtin_LINE())
{
    return sqlogmblkEx(nullptr, size, sqloZeroFilled, block, file, line, 0);
}
