// Appends a full backup to a recovery history: append DIRECTORY/ TIMESTAMP TABLESPACE...
//
//   g++ -std=c++17 -o append append.cpp $(pkg-config --cflags --libs libsqluhist)
#include <cstdio>
#include <cstring>

#include "history/sqluhist.h"
#include "sqo/sqlzkrcb.h"

static textBuffer textOf(char* text)
{
    uint32_t length = static_cast<uint32_t>(strlen(text));
    return {text, length + 1, length};
}

// What the header says of the entries is for their writer to keep.
static void keepCounts(SQLUH_HEADER* header, const SQLUH_ENTRY* entry, long long offset)
{
    const zq3HistoryData* data = entry->data;
    header->entryCount++;
    if (header->number8 < data->numTablespaces)
        header->number8 = data->numTablespaces;
    if (header->maxCommandLength < entry->commandLength)
        header->maxCommandLength = entry->commandLength;
    if (memcmp(header->timestamp, data->objectPart.data, timestampWidth) <= 0) {
        memcpy(header->timestamp, data->objectPart.data, timestampWidth); // the newest entry's,
        header->offset3 = static_cast<uint64_t>(offset);                  // which begins here
    }
}

static int appendEntry(SQLUH_HANDLE* handle, SQLUH_ENTRY* entry)
{
    long long offset = 0;
    entry->data->entryNumber = handle->header.entryCount + 1;
    int rc = sqloseek(handle->fileHandle, 0, sqloFromEnd, &offset);
    if (rc == 0)
        rc = sqluhWriteEntry(handle, entry);
    if (rc == 0)
        keepCounts(&handle->header, entry, offset);
    return rc;
}

int main(int argc, char** argv)
{
    enum : int { maxNames = 100 };
    if (argc < 4 || argc - 3 > maxNames || strlen(argv[2]) != timestampWidth) {
        fprintf(stderr, "usage: append DIRECTORY/ TIMESTAMP TABLESPACE...\n");
        return 2;
    }
    char objectPart[zq3ObjectPartCapacity];
    snprintf(objectPart, sizeof objectPart, "%s001", argv[2]);
    textBuffer names[maxNames];
    for (int i = 3; i < argc; i++)
        names[i - 3] = textOf(argv[i]);

    zq3HistoryData data = {};
    data.objectPart = textOf(objectPart);
    data.operation = zq3OperationBackup;
    data.object = zq3ObjectDatabase;
    data.operationType = 'F';
    data.status = zq3StatusActive;
    data.auxCode = '-';
    data.entryNode = static_cast<uint16_t>(sqlz_krcbp->nodeNumber);
    data.tablespaceBuffers = names;
    data.numTablespaces = static_cast<uint32_t>(argc - 3);
    SQLUH_ENTRY entry = {};
    entry.data = &data;

    SQLUH_HANDLE* handle = nullptr;
    int rc = sqluhBeginBatch(&handle, argv[1]);
    if (rc == 0) {
        rc = appendEntry(handle, &entry);
        int ended = sqluhEndBatch(&handle, rc == 0 ? sqluhCommit : sqluhAbandon);
        if (rc == 0)
            rc = ended;
    }
    if (rc != 0)
        fprintf(stderr, "append: nothing was appended: code %d\n", rc);
    return rc == 0 ? 0 : 1;
}
