// Creation of a new, empty pair of files. Stands on the writing of headers.

#include <cstring>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhist.h"
#include "sqo/sqlzkrcb.h"

static void initialHeader(SQLUH_HEADER* header)
{
    memset(header, 0, sizeof *header);
    header->nodeNumber = static_cast<uint16_t>(sqlz_krcbp->nodeNumber);
    header->status = statusConsistent;
    header->number15 = 1;
    memcpy(header->timestamp, SQLUH_EMPTY_TIMESTAMP, timestampWidth);
}

int sqluhCreate(char* directory)
{
    pdtEntry1(directory, strlen(directory));

    char historyPath[createPathCapacity] = {};
    char shadowPath[createPathCapacity] = {};
    SQLO_FHANDLE fh = sqloNoFile;
    SQLUH_HEADER header;
    int rc = 0;

    if (strlen(directory) > maxCreateDirectoryLength) {
        rc = logged(sqluhPathTooLong);
    } else {
        ossSnprintf(historyPath, sizeof historyPath, "%s" SQLUH_HISTORY_NAME, directory);
        ossSnprintf(shadowPath, sizeof shadowPath, "%s" SQLUH_SHADOW_NAME, directory);
        rc = logged(createdCode(sqloopenp(historyPath, sqloOpenNew, sqloPermissions, &fh)));
    }
    if (rc == 0) {
        initialHeader(&header);
        rc = logged(sqluhWriteHeader(fh, &header));
        bool written = rc == 0;
        rc = firstOf(rc, logged(sqloclose(fh)));
        // The shadow comes into being as the copy of a complete history file, never before it. The
        // open and the copy make the two names durable (D), the write keeps a part of a header from
        // passing for one (N).
        if (written)
            rc = firstOf(rc, logged(sqlocopy(historyPath, shadowPath, 0)));
    }

    pdtExit(rc);
    return rc;
}
