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

// One record: what happened in the function, its code unless null, its data unless empty.
static void writeTrace(const char* function, const char* event, const int* code, const void* data,
                       size_t size)
{
    const int number = errno;
    char line[1024];
    osseText record = {line, sizeof line, 0, false};
    osseTextStamp(&record);
    osseTextFormat(&record, " %s %s", function == nullptr ? "" : function, event);
    if (code != nullptr)
        osseTextFormat(&record, " %d (0x%08X)", *code, static_cast<unsigned int>(*code));
    if (data != nullptr && size != 0) {
        const size_t shown = size < maxTraceData ? size : maxTraceData;
        osseTextAdd(&record, " \"", 2);
        osseTextAddEscaped(&record, static_cast<const char*>(data), shown, "\\x0A");
        osseTextAdd(&record, "\"", 1);
        if (shown < size)
            osseTextFormat(&record, " (%zu of %zu bytes shown)", shown, size);
    }
    osseTextEnd(&record);
    // A trace that cannot be written is lost; there is nobody to tell.
    [[maybe_unused]] const ssize_t ignored = write(traceDescriptor, record.data, record.length);
    errno = number;
}

void osseTraceMemory(size_t size, const char* file, unsigned int line)
{
    if (!traceIsOn)
        return;
    char data[512];
    osseText place = {data, sizeof data, 0, false};
    osseTextFormat(&place, "%zu bytes for %s:%u", size, file == nullptr ? "" : file, line);
    writeTrace("memory", "refused", nullptr, place.data, place.length);
}

OSSE_EXPORT int sqltGetCompTraceFlag(void)
{
    return traceIsOn ? 1 : 0;
}

OSSE_EXPORT void sqltError(const char* function, int code)
{
    if (traceIsOn)
        writeTrace(function, "error", &code, nullptr, 0);
}

OSSE_EXPORT void sqltData(const char* function, const char* label, const void* data, size_t size)
{
    if (traceIsOn)
        writeTrace(function, label == nullptr ? "data" : label, nullptr, data, size);
}

OSSE_EXPORT void pdtEntry(const char* function)
{
    if (traceIsOn)
        writeTrace(function, "entry", nullptr, nullptr, 0);
}

OSSE_EXPORT void pdtEntry1(const void* data, size_t size, const char* function)
{
    if (traceIsOn)
        writeTrace(function, "entry", nullptr, data, size);
}

OSSE_EXPORT void pdtExit(int rc, const char* function)
{
    if (traceIsOn)
        writeTrace(function, "exit", &rc, nullptr, 0);
}

OSSE_EXPORT void pdtExit1(int rc, const void* data, size_t size, const char* function)
{
    if (traceIsOn)
        writeTrace(function, "exit", &rc, data, size);
}
