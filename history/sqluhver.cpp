// Verification: reads entries and repairs nothing. Stands on the readers of header and entries.

#include "history/sqluhDiagnostics.h"
#include "history/sqluhred.h"

// Checks one entry for the operation that verifies it.
static int verifyEntry(SQLO_FHANDLE fileHandle, SQLUH_WORKAREA* workArea, sqluhProvenEntry* proven)
{
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    entry.data = &data;
    int rc = sqluhCheckEntry(fileHandle, &entry, workArea, proven);
    if (rc != END_OF_FILE)
        loggedPlain(rc, "sqluhVerifyOneEntry");
    return rc;
}

int sqluhVerifyOneEntry(SQLO_FHANDLE fileHandle, SQLUH_WORKAREA* workArea)
{
    pdtEntry();

    sqluhProvenEntry proven;
    sqluhBeginProving(&proven, false);
    int rc = verifyEntry(fileHandle, workArea, &proven);

    pdtExit(rc);
    return rc;
}

int sqluhVerifyHistoryEntries(SQLO_FHANDLE fileHandle, SQLUH_WORKAREA* workArea)
{
    pdtEntry();

    sqluhProvenEntry proven;
    sqluhBeginProving(&proven, true);
    int rc = 0;
    while (rc == 0)
        rc = verifyEntry(fileHandle, workArea, &proven);
    if (rc == END_OF_FILE)
        rc = 0;

    pdtExit(rc);
    return rc;
}

int sqluhVerifyUnopenedHistoryFile(char* path, SQLUH_WORKAREA* workArea)
{
    pdtEntry();

    SQLO_FHANDLE fh = sqloNoFile;
    SQLUH_HEADER header;
    int rc = logged(sqloopenp(path, sqloOpenRead, sqloPermissions, &fh));
    if (rc == 0) {
        rc = logged(sqluhReadHeader(fh, &header));
        if (rc == 0) {
            rc = sqluhVerifyHistoryEntries(fh, workArea);
            if (rc != 0)
                logRecord({textItem(TEXT_VERIFY_FILE), textItem(path), codeItem("", rc)});
        }
        rc = firstOf(rc, sqloclose(fh));
    }

    pdtExit(rc);
    return rc;
}

int sqluh_verify_history_files(SQLUH_HANDLE* handle)
{
    pdtEntry();

    int rc = sqluhVerifyHistoryEntries(handle->fileHandle, &handle->workArea);
    if (rc != 0)
        logRecord({textItem(TEXT_VERIFY_HANDLE), codeItem("", rc)});

    pdtExit(rc);
    return rc;
}
