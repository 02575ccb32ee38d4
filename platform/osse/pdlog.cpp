// The diagnostic log: one record is one write, so that records of several processes, appended to
// the same file, never mix.
//
//   2026-03-01-12.00.00.000000 pid=1 level=Error function=f: text rc = -1 (0xFFFFFFFF)
//       label: 2 bytes
//       0000  41 42                                            |AB|
//
// Only a record's first line begins at the margin. Logging never fails its caller and leaves errno
// alone.
#include "osse.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <syslog.h>
#include <unistd.h>

#include "sqo/sqlpd.h"

static constexpr char continuation[] = "\n    ";
static constexpr size_t maxDump = 4096;
static constexpr size_t dumpWidth = 16;

// Room for two dumps of the greatest length and their surroundings.
static constexpr size_t recordCapacity = 64 * 1024;

struct levelRow {
    const char* name;
    int priority;
};
static const levelRow levels[] = {
    {"Unknown", LOG_ERR},     {"Error", LOG_ERR},     {"Severe", LOG_CRIT},
    {"Warning", LOG_WARNING}, {"Notice", LOG_NOTICE},
};

static const levelRow* rowOfLevel(int level)
{
    return &levels[level >= pdLevelError && level <= pdLevelNotice ? level : 0];
}

static const char* orEmpty(const char* text)
{
    return text == nullptr ? "" : text;
}

// A line feed at the end of a message ends it and starts no line of its own.
static void addMessage(osseText* record, const char* message)
{
    size_t length = strlen(message);
    while (length > 0 && message[length - 1] == '\n')
        length--;
    osseTextAddEscaped(record, message, length, continuation);
}

static void addLabel(osseText* record, const char* label)
{
    addMessage(record, label);
    const size_t length = strlen(label);
    if (length > 0 && label[length - 1] != ' ')
        osseTextAdd(record, " ", 1);
}

static void addCode(osseText* record, const char* label, int code)
{
    addLabel(record, label);
    osseTextFormat(record, "%d (0x%08X)", code, static_cast<unsigned int>(code));
}

static void addDumpLine(osseText* record, const unsigned char* bytes, size_t offset, size_t count)
{
    char line[dumpWidth * 4 + 4];
    char* at = line;
    for (size_t i = 0; i < dumpWidth; i++)
        at += i < count ? sprintf(at, "%02X ", bytes[offset + i]) : sprintf(at, "   ");
    *at++ = ' ';
    *at++ = '|';
    for (size_t i = 0; i < count; i++)
        *at++ = bytes[offset + i] >= ' ' && bytes[offset + i] < 0x7F
                    ? static_cast<char>(bytes[offset + i])
                    : '.';
    *at++ = '|';
    osseTextFormat(record, "%s%04zX  ", continuation, offset);
    osseTextAdd(record, line, static_cast<size_t>(at - line));
}

static void addDump(osseText* record, const char* label, const void* data, size_t size)
{
    const size_t shown = data == nullptr ? 0 : size < maxDump ? size : maxDump;
    osseTextAdd(record, continuation, strlen(continuation));
    addMessage(record, label);
    osseTextFormat(record, "%s%zu bytes", *label == '\0' ? "" : ": ", size);
    for (size_t offset = 0; offset < shown; offset += dumpWidth)
        addDumpLine(record, static_cast<const unsigned char*>(data), offset,
                    shown - offset < dumpWidth ? shown - offset : dumpWidth);
    if (shown < size)
        osseTextFormat(record, "%s(%zu of %zu bytes shown)", continuation, shown, size);
}

static void addItem(osseText* record, const pdItem* item)
{
    if (item->kind == pdKindCode) {
        addCode(record, orEmpty(item->text), static_cast<int>(item->value));
    } else if (item->kind == pdKindNumber) {
        addLabel(record, orEmpty(item->text));
        osseTextFormat(record, "%lld", static_cast<long long>(item->value));
    } else {
        addMessage(record, orEmpty(item->text));
    }
}

// Appends the record to the log file in one write, or hands it to the system log.
static void deliver(const osseText* record, int level)
{
    const char* path = getenv("ZQ3DIAGLOG");
    if (path != nullptr && *path != '\0') {
        const int descriptor = osseOpen(path, O_WRONLY | O_APPEND | O_CREAT, 0640);
        if (descriptor >= 0) {
            const ssize_t written = osseAppend(descriptor, record->data, record->length);
            close(descriptor);
            if (written > 0)
                return;
        }
    }
    syslog(LOG_USER | rowOfLevel(level)->priority, "%s", record->data);
}

static void logItems(const char* function, int level, const pdItem* items, unsigned int numItems)
{
    const int number = errno;
    char data[recordCapacity];
    osseText record = {data, sizeof data, 0, false};
    osseTextStamp(&record);
    osseTextFormat(&record, " level=%s function=%s:", rowOfLevel(level)->name, orEmpty(function));
    for (unsigned int i = 0; i < numItems; i++) {
        if (items[i].kind != pdKindData) {
            osseTextAdd(&record, " ", 1);
            addItem(&record, &items[i]);
        }
    }
    for (unsigned int i = 0; i < numItems; i++) {
        if (items[i].kind == pdKindData)
            addDump(&record, orEmpty(items[i].text), items[i].data, items[i].size);
    }
    osseTextEnd(&record);
    deliver(&record, level);
    errno = number;
}

OSSE_EXPORT void pdLog(const char* function, int level, const pdItem* items, unsigned int numItems)
{
    logItems(function, level, items, numItems);
}

OSSE_EXPORT void pdLogPrintf(const char* function, int level, const char* format, ...)
{
    const int number = errno;
    char message[4096];
    va_list arguments;
    va_start(arguments, format);
    const int length = vsnprintf(message, sizeof message, format, arguments);
    va_end(arguments);
    errno = number;
    const pdItem item = {pdKindText, length < 0 ? format : message, 0, nullptr, 0};
    logItems(function, level, &item, 1);
}

OSSE_EXPORT void pdLogSysRC(const char* function, const char* systemCall, int systemErrno, int code)
{
    const int number = errno;
    char reason[128];
    const pdItem items[] = {
        {pdKindText, systemCall, 0, nullptr, 0},
        {pdKindNumber, "errno = ", systemErrno, nullptr, 0},
        {pdKindText, strerror_r(systemErrno, reason, sizeof reason), 0, nullptr, 0},
        {pdKindCode, "rc = ", code, nullptr, 0},
    };
    errno = number;
    logItems(function, pdLevelError, items, sizeof items / sizeof items[0]);
}

struct adminRow {
    int message;
    const char* text;
};
static const adminRow adminMessages[] = {
    {pdAdminReadFailed,
     "A record of the recovery history could not be read. Keep copies of the history\n"
     "file and of its shadow, then have every entry of both verified; when both are damaged, "
     "restore\n"
     "the history from a backup image."},
    {pdAdminDiskFull, "The file system that holds the recovery history is full. Free space on it,\n"
                      "then repeat the operation that was being recorded."},
};

OSSE_EXPORT void sqlt_logadmin(const char* function, int message)
{
    const char* text = "";
    for (const adminRow& row : adminMessages) {
        if (row.message == message)
            text = row.text;
    }
    const pdItem items[] = {{pdKindNumber, "Administration message", message, nullptr, 0},
                            {pdKindText, text, 0, nullptr, 0}};
    logItems(function, pdLevelError, items, *text == '\0' ? 1 : 2);
}

OSSE_EXPORT void sqlt_logerr_data(const char* function, const char* title, const void* data,
                                  size_t size)
{
    const pdItem item = {pdKindData, title, 0, data, size};
    logItems(function, pdLevelError, &item, 1);
}
