// The small calls: file information, formatting, communication area, code mapping.
#include "osse.h"

#include <cstdio>
#include <cstring>
#include <sys/stat.h>

OSSE_EXPORT bool ossPathExists(const char* path)
{
    struct stat status;
    return stat(path, &status) == 0;
}

OSSE_EXPORT int ossFileGetInfoV9(const ossFileRequest* request, ossFileInfo* info)
{
    if (request->version != ossFileVersion || request->level != 1)
        return systemFailure(EINVAL);
    struct stat status;
    if (stat(request->path, &status) != 0)
        return systemFailure(errno);
    *info = {};
    info->size = static_cast<uint64_t>(status.st_size);
    return 0;
}

OSSE_EXPORT int ossSnprintf(char* buffer, size_t size, const char* format, ...)
{
    va_list arguments;
    va_start(arguments, format);
    const int length = vsnprintf(buffer, size, format, arguments);
    va_end(arguments);
    return length;
}

OSSE_EXPORT void sqloinca(sqlca* ca)
{
    memset(ca, ' ', sizeof *ca);
    memcpy(ca->sqlcaid, "SQLCA   ", sizeof ca->sqlcaid);
    ca->sqlcabc = sizeof *ca;
    ca->sqlcode = 0;
    ca->sqlerrml = 0;
    memset(ca->sqlerrd, 0, sizeof ca->sqlerrd);
}

OSSE_EXPORT int sqlzGetZRCInfo(int code)
{
    return code < 0 ? code : systemFailure(EIO);
}
