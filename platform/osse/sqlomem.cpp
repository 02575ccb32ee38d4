// Memory blocks. Every block has a small header in front of what the caller sees.
//
// Large blocks come from mmap: their pages are zero without being touched, so a work area of some
// megabytes costs nothing until it is used, and growing one moves pages instead of bytes. Under the
// address sanitizer every block comes from malloc, which the sanitizer guards.
#include "osse.h"

#include <cstdlib>
#include <cstring>
#include <sys/mman.h>
#include <unistd.h>

#if defined(__has_feature)
#if __has_feature(address_sanitizer)
#define OSSE_GUARDED_HEAP 1
#endif
#endif
#if defined(__SANITIZE_ADDRESS__)
#define OSSE_GUARDED_HEAP 1
#endif

#ifdef OSSE_GUARDED_HEAP
static constexpr size_t mapThreshold = SIZE_MAX;
#else
static constexpr size_t mapThreshold = 1024 * 1024;
#endif

enum : uint32_t { blockOfHeap = 0x48454150, blockOfMap = 0x4D415021 };

struct alignas(16) blockHeader {
    size_t size; // bytes that the caller asked for
    uint32_t kind;
};
static constexpr size_t maxBlock = PTRDIFF_MAX - 2 * sizeof(blockHeader) - 65536;

static size_t mapLength(size_t size)
{
    const size_t page = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    return (size + sizeof(blockHeader) + page - 1) / page * page;
}

static blockHeader* newBlock(size_t size, bool zeroFilled)
{
    blockHeader* header = nullptr;
    if (size > maxBlock)
        return nullptr;
    if (size >= mapThreshold) {
        void* map = mmap(nullptr, mapLength(size), PROT_READ | PROT_WRITE,
                         MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        if (map != MAP_FAILED)
            header = static_cast<blockHeader*>(map);
    } else {
        const size_t length = size + sizeof *header;
        header = static_cast<blockHeader*>(zeroFilled ? calloc(1, length) : malloc(length));
    }
    if (header != nullptr)
        *header = {size, size >= mapThreshold ? blockOfMap : blockOfHeap};
    return header;
}

static void deleteBlock(blockHeader* header)
{
    if (header->kind == blockOfMap)
        munmap(header, mapLength(header->size));
    else
        free(header);
}

static blockHeader* headerOf(void* block)
{
    return static_cast<blockHeader*>(block) - 1;
}

OSSE_EXPORT int sqlogmblkEx(SMemPool*, size_t size, unsigned int options, void** block,
                            const char* file, unsigned int line, unsigned int)
{
    blockHeader* header = newBlock(size, (options & sqloZeroFilled) != 0);
    *block = header == nullptr ? nullptr : header + 1;
    if (header != nullptr)
        return 0;
    osseTraceMemory(size, file, line);
    return systemFailure(ENOMEM);
}

OSSE_EXPORT void sqlofmblkEx(void* block)
{
    if (block != nullptr)
        deleteBlock(headerOf(block));
}

// Resizes a block within its kind; null when there is no memory.
static blockHeader* resizeInKind(blockHeader* header, size_t size)
{
    if (header->kind == blockOfHeap)
        return static_cast<blockHeader*>(realloc(header, size + sizeof *header));
    void* map = mremap(header, mapLength(header->size), mapLength(size), MREMAP_MAYMOVE);
    return map == MAP_FAILED ? nullptr : static_cast<blockHeader*>(map);
}

static blockHeader* resizeBlock(blockHeader* header, size_t size)
{
    if (size > maxBlock)
        return nullptr;
    if (header->kind == blockOfMap || size < mapThreshold)
        return resizeInKind(header, size);

    blockHeader* grown = newBlock(size, false);
    if (grown != nullptr) {
        memcpy(grown + 1, header + 1, header->size);
        deleteBlock(header);
    }
    return grown;
}

// Zeroes what a resize added. Pages that a mapping gained are zero already and stay untouched.
static void clearAdded(blockHeader* header, size_t oldSize, size_t size, bool wasMapped)
{
    size_t end = size;
    if (header->kind == blockOfMap) {
        const size_t oldEnd = wasMapped ? mapLength(oldSize) - sizeof *header : oldSize;
        end = oldEnd < size ? oldEnd : size;
    }
    if (end > oldSize)
        memset(reinterpret_cast<unsigned char*>(header + 1) + oldSize, 0, end - oldSize);
}

OSSE_EXPORT int sqloMemBlockReallocate(void** block, size_t size, unsigned int options,
                                       const char* file, unsigned int line)
{
    const bool zeroFilled = (options & sqloZeroFilled) != 0;
    blockHeader* old = *block == nullptr ? nullptr : headerOf(*block);
    const size_t oldSize = old == nullptr ? 0 : old->size;
    const bool wasMapped = old != nullptr && old->kind == blockOfMap;

    blockHeader* header = old == nullptr ? newBlock(size, zeroFilled) : resizeBlock(old, size);
    if (header == nullptr) {
        osseTraceMemory(size, file, line);
        return systemFailure(ENOMEM);
    }
    header->size = size;
    if (old != nullptr && zeroFilled && size > oldSize)
        clearAdded(header, oldSize, size, wasMapped);
    *block = header + 1;
    return 0;
}
