/* Lists the backups in the history of a database: scan ALIAS

     cc -std=c11 -o scan scan.c $(pkg-config --cflags --libs zq3)

   ZQ3DBPATH names the folder that holds the history directory. */
#include <stdio.h>

#include "zq3.h"

static int tell(const char* call, const sqlca* ca)
{
    if (ca->sqlcode < 0)
        fprintf(stderr, "%s: SQLCODE %d\n", call, (int)ca->sqlcode);
    return ca->sqlcode;
}

int main(int argc, char** argv)
{
    if (argc != 2) {
        fprintf(stderr, "usage: scan ALIAS\n");
        return 2;
    }
    sqlca ca = {0}, outcome = {0};
    zq3HistoryOpenStruct request = {.databaseAlias = argv[1]};
    zq3HistoryOpenScan(zq3Version, &request, &ca);
    if (tell("zq3HistoryOpenScan", &ca) < 0)
        return 1;

    char objectPart[zq3ObjectPartCapacity];
    zq3HistoryData data = {.objectPart = {objectPart, sizeof objectPart, 0},
                           .eventSqlca = &outcome};
    zq3HistoryFetchStruct fetch = {&data, request.handle, 2};
    for (;;) {
        zq3HistoryGetEntry(zq3Version, &fetch, &ca);
        if (tell("zq3HistoryGetEntry", &ca) < 0 || ca.sqlcode == 100)
            break;
        if (data.operation == zq3OperationBackup)
            printf("%.14s, %u tablespaces\n", objectPart, (unsigned)data.numTablespaces);
    }
    sqlca closing = {0};
    zq3HistoryCloseScan(zq3Version, &request.handle, &closing);
    return tell("zq3HistoryCloseScan", &closing) < 0 || ca.sqlcode < 0;
}
