// Allocations that fail on demand: the ZQ3FAILAT-th of the process. Linked with --wrap, so only the
// product's own requests count.
#include <cstdlib>

static bool exiting = false;

// What the runtime allocates after this, to write coverage data, has to succeed.
__attribute__((destructor)) static void stopFailing()
{
    exiting = true;
}

static bool isFailing()
{
    static const char* failAt = getenv("ZQ3FAILAT");
    static int requests = 0;
    return failAt != nullptr && !exiting && ++requests == atoi(failAt);
}

extern "C" {
void* __real_malloc(size_t size);
void* __real_calloc(size_t count, size_t size);
void* __real_realloc(void* block, size_t size);

void* __wrap_malloc(size_t size)
{
    return isFailing() ? nullptr : __real_malloc(size);
}

void* __wrap_calloc(size_t count, size_t size)
{
    return isFailing() ? nullptr : __real_calloc(count, size);
}

void* __wrap_realloc(void* block, size_t size)
{
    return isFailing() ? nullptr : __real_realloc(block, size);
}
}
