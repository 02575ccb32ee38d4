#include "faults.h"

#include <algorithm>

#include <dlfcn.h>

#include "sqo/sqlo.h"

faultState faults;

void armFault(const faultPlan& plan)
{
    faults = {plan, {}, 0, 0};
}

static bool fails(osCall call)
{
    return ++faults.calls[call] == faults.plan.at && call == faults.plan.call;
}

template <typename Function> static Function* real(Function*, const char* name)
{
    return reinterpret_cast<Function*>(dlsym(RTLD_NEXT, name));
}
#define REAL(function) real(function, #function)

extern "C" {

int sqloopenp(const char* path, unsigned int options, unsigned int permissions, SQLO_FHANDLE* fh)
{
    bool failing = fails(osOpen);
    // A positive code is a warning: the file is open.
    int rc = failing && faults.plan.code < 0 ? 0 : REAL(sqloopenp)(path, options, permissions, fh);
    return failing ? faults.plan.code : rc;
}

int sqloclose(SQLO_FHANDLE fh)
{
    int rc = REAL(sqloclose)(fh);
    return fails(osClose) ? faults.plan.code : rc;
}

#define TRANSFER(function, call, Buffer)                                                           \
    int function(SQLO_FHANDLE fh, Buffer buffer, uint32_t count, uint32_t* moved)                  \
    {                                                                                              \
        bool failing = fails(call);                                                                \
        count = failing ? static_cast<uint32_t>(faults.plan.transferred) : count;                  \
        int rc = REAL(function)(fh, buffer, count, moved);                                         \
        return failing ? faults.plan.code : rc;                                                    \
    }
TRANSFER(sqloread, osRead, void*)
TRANSFER(sqlowrite, osWrite, const void*)

#define CALL(function, call, parameters, arguments)                                                \
    int function parameters                                                                        \
    {                                                                                              \
        return fails(call) ? faults.plan.code : REAL(function) arguments;                          \
    }
CALL(sqloseek, osSeek, (SQLO_FHANDLE fh, long long offset, unsigned int origin, long long* to),
     (fh, offset, origin, to))
CALL(sqlocopy, osCopy, (const char* source, const char* target, unsigned int options),
     (source, target, options))
CALL(sqlogmblkEx, osAllocate,
     (SMemPool * pool, size_t size, unsigned int options, void** block, const char* file,
      unsigned int line, unsigned int reserved),
     (pool, size, options, block, file, line, reserved))

int sqloMemBlockReallocate(void** block, size_t size, unsigned int options, const char* file,
                           unsigned int line)
{
    faults.largestReallocation = std::max(faults.largestReallocation, size);
    return fails(osReallocate) ? faults.plan.code
                               : REAL(sqloMemBlockReallocate)(block, size, options, file, line);
}

int sqlzGetZRCInfo(int code)
{
    faults.lastMapped = code;
    return faults.plan.call != osNone ? mappedCode : REAL(sqlzGetZRCInfo)(code);
}

} // extern "C"
