// The library's primitives: checksum, formatting, position, backup types, paths. Stands on the
// OS-services interface alone.

#include "history/sqluhfun.h"

#include <clocale>
#include <cstdarg>
#include <cstdio>
#include <cstring>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhist.h"

// --- Checksum and formatting ---------------------------------------------------------------------

// Sixteen bytes, exclusive-ored at once where the machine can.
typedef uint64_t wideWord __attribute__((vector_size(16)));

static inline wideWord wideWordAt(const unsigned char* at)
{
    wideWord word;
    memcpy(&word, at, sizeof word);
    return word;
}

uint32_t sqluhChecksum(void* buffer, unsigned int length)
{
    pdtEntry();

    // Exclusive-or does not care about order: wide words side by side, folded at the end, cost what
    // fetching the bytes costs.
    const unsigned char* at = static_cast<const unsigned char*>(buffer);
    const unsigned char* end = at + length;
    wideWord lanes[4] = {};
    for (; end - at >= 64; at += sizeof lanes) {
        lanes[0] ^= wideWordAt(at);
        lanes[1] ^= wideWordAt(at + 16);
        lanes[2] ^= wideWordAt(at + 32);
        lanes[3] ^= wideWordAt(at + 48);
    }
    lanes[0] ^= lanes[1] ^ lanes[2] ^ lanes[3];
    uint64_t folded = lanes[0][0] ^ lanes[0][1];
    uint32_t sum = static_cast<uint32_t>(folded) ^ static_cast<uint32_t>(folded >> 32);
    uint32_t word;
    for (; end - at >= 4; at += sizeof word) {
        memcpy(&word, at, sizeof word);
        sum ^= word;
    }
    word = 0;
    memcpy(&word, at, static_cast<size_t>(end - at));
    sum ^= word;

    pdtExit(0);
    return sum;
}

int sqluhSprintf(char* buffer, const char* format, ...)
{
    pdtEntry();

    // For this thread alone, where setlocale would switch the whole process and hand out a name
    // that another thread may free: handles may be in use side by side. For "C" the system hands
    // out the one object that it has; nothing is allocated.
    locale_t callers = uselocale(newlocale(LC_ALL_MASK, "C", nullptr));
    va_list arguments;
    va_start(arguments, format);
    int length = vsprintf(buffer, format, arguments);
    va_end(arguments);
    uselocale(callers);

    pdtExit(length);
    return length;
}

int sqluhRewind(SQLO_FHANDLE fh, long long* newOffset)
{
    pdtEntry();
    int rc = sqloseek(fh, headerLength, sqloFromStart, newOffset);
    pdtExit(rc);
    return rc;
}

// --- Backup types --------------------------------------------------------------------------------

static bool traceTest(bool result, const char* function = __builtin_FUNCTION())
{
    pdtExit1(result, &result, sizeof result, function);
    return result;
}

bool sqluhIsHistEntryIncr(char operationType)
{
    pdtEntry();
    return traceTest(operationType == typeIncremental || operationType == typeIncrementalOther);
}

bool sqluhIsHistEntryDelta(char operationType)
{
    pdtEntry();
    return traceTest(operationType == typeDelta || operationType == typeDeltaOther);
}

bool sqluhIsHistEntryIncrOrDelta(char operationType)
{
    pdtEntry();
    return traceTest(sqluhIsHistEntryIncr(operationType) || sqluhIsHistEntryDelta(operationType));
}

// --- Paths ---------------------------------------------------------------------------------------

int sqluhCheckDirectory(const char* directory)
{
    size_t length = strlen(directory);
    return length == 0 || directory[length - 1] == '/' ? 0 : sqluhPathNoSeparator;
}

int sqluhJoinPath(char* path, size_t capacity, const char* directory, const char* name)
{
    int length = ossSnprintf(path, capacity, "%s%s", directory, name);
    return length < 0 || static_cast<size_t>(length) >= capacity ? sqluhPathTooLong : 0;
}
