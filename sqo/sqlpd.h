// The diagnostic log and the trace facility. Declarations only; libzq3osse.so.1 provides them.
//
// The functions are named by their own name, which the compiler supplies: no table of identifiers
// has to be kept in step with the code. No call fails its caller or changes errno, and none keeps
// what it is given.
#pragma once

#include <cstddef>
#include <cstdint>

enum : int { pdLevelError = 1, pdLevelSevere = 2, pdLevelWarning = 3, pdLevelNotice = 4 };

enum : int { pdKindText, pdKindCode, pdKindNumber, pdKindData };

// One piece of a log record. A label or a text is terminated and belongs to the caller.
struct pdItem {
    int kind;         // pdKindText, pdKindCode, pdKindNumber or pdKindData
    const char* text; // the text, or the label of a code, number or dump; may be empty, not null
    int64_t value;    // pdKindCode: the 32-bit code; pdKindNumber: the number
    const void* data; // pdKindData: the bytes
    size_t size;      // pdKindData: their number
};

// Numbers of the administration-log messages.
enum : int { pdAdminReadFailed = 8500, pdAdminDiskFull = 8501 };

extern "C" {

// Appends one record: severity, function, then the items in order, dumps last. A code is shown in
// decimal and as 32-bit hexadecimal.
void pdLog(const char* function, int level, const pdItem* items, unsigned int numItems);

// Appends one record with a formatted text.
void pdLogPrintf(const char* function, int level, const char* format, ...)
    __attribute__((format(printf, 3, 4)));

// Appends one record about a failed system call: its name, its errno, the code made of it.
void pdLogSysRC(const char* function, const char* systemCall, int systemErrno, int code);

// Appends an administration-log message by its number.
void sqlt_logadmin(const char* function, int message);

// Appends one record with a dump under a title.
void sqlt_logerr_data(const char* function, const char* title, const void* data, size_t size);

// Nonzero while tracing is on.
int sqltGetCompTraceFlag(void);

// Trace records; with tracing off each costs a test of a flag. Data is shown as hexadecimal digits:
// of 1, 2, 4 or 8 bytes as one number, else byte by byte. The data of an entry is a text.
void sqltError(const char* function, int code);
void sqltData(const char* function, const char* label, const void* data, size_t size);
void pdtEntry(const char* function = __builtin_FUNCTION());
void pdtEntry1(const void* text, size_t size, const char* function = __builtin_FUNCTION());
void pdtExit(int rc, const char* function = __builtin_FUNCTION());
void pdtExit1(int rc, const void* data, size_t size, const char* function = __builtin_FUNCTION());

} // extern "C"
