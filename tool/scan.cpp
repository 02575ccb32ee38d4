// Fetching through the scan interface of the client library.
#include "tool/zq3ckrst.h"

static int openByClient(void* context, zq3HistoryOpenStruct* open, sqlca* ca)
{
    open->databaseAlias = static_cast<char*>(context);
    return zq3HistoryOpenScan(zq3Version, open, ca);
}

static int getByClient(void*, zq3HistoryFetchStruct* fetch, sqlca* ca)
{
    return zq3HistoryGetEntry(zq3Version, fetch, ca);
}

static int closeByClient(void*, uint16_t* handle, sqlca* ca)
{
    return zq3HistoryCloseScan(zq3Version, handle, ca);
}

int fetchHistoryEntries(char* alias, char* timestamp, historyData* data, int* numBackups)
{
    const historySource scan = {alias, openByClient, getByClient, closeByClient};
    return fetchFromSource(&scan, timestamp, data, numBackups);
}
