#include "memoryfile.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "history/sqluhist.h"
#include "sqo/sqlpd.h"

static const uint8_t* fileBytes;
static long long fileSize;
long long filePosition;
char lastHeader[1024];

void serveFile(const uint8_t* bytes, size_t size)
{
    fileBytes = bytes;
    fileSize = static_cast<long long>(size);
    filePosition = 0;
}

extern "C" {

int sqloread(SQLO_FHANDLE, void* buffer, uint32_t count, uint32_t* bytesRead)
{
    long long left = std::clamp(fileSize - filePosition, 0LL, static_cast<long long>(count));
    if (left != 0)
        memcpy(buffer, fileBytes + filePosition, static_cast<size_t>(left));
    filePosition += left;
    *bytesRead = static_cast<uint32_t>(left);
    return *bytesRead == count ? 0 : static_cast<int>(END_OF_FILE);
}

int sqlowrite(SQLO_FHANDLE, const void* buffer, uint32_t count, uint32_t* bytesWritten)
{
    REQUIRE(filePosition == 0 && count == sizeof lastHeader);
    memcpy(lastHeader, buffer, count);
    *bytesWritten = count;
    return 0;
}

int sqloseek(SQLO_FHANDLE, long long offset, unsigned int origin, long long* newOffset)
{
    const long long bases[] = {0, filePosition, fileSize};
    long long position = 0;
    if (__builtin_add_overflow(bases[origin], offset, &position) || position < 0)
        return static_cast<int>(sqloSystemError) | 22;
    filePosition = position;
    if (newOffset != nullptr)
        *newOffset = position;
    return 0;
}

// A work area is asked for whole and hardly used: one block that is never cleared serves them all.
static char largeBlock[defaultWorkAreaSize + 65536];

int sqlogmblkEx(SMemPool*, size_t size, unsigned int, void** block, const char*, unsigned int,
                unsigned int)
{
    REQUIRE(size <= sizeof largeBlock);
    *block = size < defaultWorkAreaSize ? calloc(1, size) : largeBlock;
    return 0;
}

void sqlofmblkEx(void* block)
{
    if (block != largeBlock)
        free(block);
}

int sqloMemBlockReallocate(void** block, size_t size, unsigned int, const char*, unsigned int)
{
    REQUIRE(*block != largeBlock);
    *block = realloc(*block, size);
    return 0;
}

void pdLog(const char*, int, const pdItem*, unsigned int)
{
}
void pdLogPrintf(const char*, int, const char*, ...)
{
}
void sqlt_logadmin(const char*, int)
{
}
void sqlt_logerr_data(const char*, const char*, const void*, size_t)
{
}
}
