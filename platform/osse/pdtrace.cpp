// The trace facility: entry, exit, errors and data of traced functions, one line and one write
// each.
#include "osse.h"

#include <cstdlib>
#include <fcntl.h>
#include <unistd.h>

#include "sqo/sqlpd.h"

static constexpr size_t maxTraceData = 128;

static int traceDescriptor = -1;
static bool traceIsOn = false;

// Before main and before any traced call: what a traced function asks later is one flag.
__attribute__((constructor)) static void openTrace()
{
    const char* path = getenv("ZQ3TRACE");
    if (path == nullptr || *path == '\0')
        return;
    traceDescriptor = osseOpen(path, O_WRONLY | O_APPEND | O_CREAT, 0640);
    traceIsOn = traceDescriptor >= 0;
}

// What a record may carry beside the function's name and what happened in it.
struct traceData {
    const int* code; // null: none
    const void* data;
    size_t size; // 0: no data
    bool isText;
};

// A text is cut between its characters, so that the trace stays what the text is, say UTF-8.
static void addText(osseText* record, const char* text, size_t size)
{
    size_t shown = size < maxTraceData ? size : maxTraceData;
    while (shown < size && shown > 0 && (text[shown] & 0xC0) == 0x80)
        shown--;
    osseTextAdd(record, " \"", 2);
    osseTextAddEscaped(record, text, shown, "\\x0A");
    osseTextAdd(record, "\"", 1);
    if (shown < size)
        osseTextFormat(record, " (%zu of %zu bytes shown)", shown, size);
}

static void addDigits(osseText* record, const unsigned char* bytes, size_t size)
{
    const size_t shown = size < maxTraceData ? size : maxTraceData;
    const bool isNumber = size == 1 || size == 2 || size == 4 || size == 8;
    osseTextAdd(record, " 0x", isNumber ? 3 : 1);
    for (size_t i = 0; i < shown; i++)
        osseTextFormat(record, "%02X", bytes[isNumber ? size - 1 - i : i]);
    if (shown < size)
        osseTextFormat(record, " (%zu of %zu bytes shown)", shown, size);
}

static void writeTrace(const char* function, const char* event, const traceData& with)
{
    const int number = errno;
    char line[1024];
    osseText record = {line, sizeof line, 0, false};
    osseTextStamp(&record);
    osseTextFormat(&record, " %s %s", function, event);
    if (with.code != nullptr)
        osseTextFormat(&record, " %d (0x%08X)", *with.code, static_cast<unsigned int>(*with.code));
    if (with.size != 0 && with.isText)
        addText(&record, static_cast<const char*>(with.data), with.size);
    else if (with.size != 0)
        addDigits(&record, static_cast<const unsigned char*>(with.data), with.size);
    osseTextEnd(&record);
    // A trace that cannot be written is lost; there is nobody to tell.
    osseAppend(traceDescriptor, record.data, record.length);
    errno = number;
}

void osseTraceMemory(size_t size, const char* file, unsigned int line)
{
    if (!traceIsOn)
        return;
    char data[512];
    osseText place = {data, sizeof data, 0, false};
    osseTextFormat(&place, "%zu bytes for %s:%u", size, file == nullptr ? "" : file, line);
    writeTrace("memory", "refused", {nullptr, place.data, place.length, true});
}

OSSE_EXPORT int sqltGetCompTraceFlag(void)
{
    return traceIsOn ? 1 : 0;
}

OSSE_EXPORT void sqltError(const char* function, int code)
{
    if (traceIsOn)
        writeTrace(function, "error", {&code, nullptr, 0, false});
}

OSSE_EXPORT void sqltData(const char* function, const char* label, const void* data, size_t size)
{
    if (traceIsOn)
        writeTrace(function, label, {nullptr, data, size, false});
}

OSSE_EXPORT void pdtEntry(const char* function)
{
    if (traceIsOn)
        writeTrace(function, "entry", {});
}

OSSE_EXPORT void pdtEntry1(const void* text, size_t size, const char* function)
{
    if (traceIsOn)
        writeTrace(function, "entry", {nullptr, text, size, true});
}

OSSE_EXPORT void pdtExit(int rc, const char* function)
{
    if (traceIsOn)
        writeTrace(function, "exit", {&rc, nullptr, 0, false});
}

OSSE_EXPORT void pdtExit1(int rc, const void* data, size_t size, const char* function)
{
    if (traceIsOn)
        writeTrace(function, "exit", {&rc, data, size, false});
}
