// Fetching the history: the calls, the entries that are kept, their order, their listing.
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "tool/nameindex.h"
#include "tool/zq3ckrst.h"

enum : int { entryGrowth = 512 };

enum : uint32_t {
    commandTextCapacity = 2097152,
    objectPartLength = zq3ObjectPartCapacity - 1, // timestamp and sequence number
    commandPrefixLength = 35,                     // what isCreateTempspace looks at
    recentLists = 256,
};

// The buffers that the gets fill, what one get left in them, and the lists made of such names.
struct scanBuffers {
    char objectPart[zq3ObjectPartCapacity];
    char secondTimestamp[zq3SecondTimestampCapacity];
    char firstText[zq3LogNameCapacity];
    char lastText[zq3LogNameCapacity];
    char idText[zq3IdTextCapacity];
    char qualifierText[zq3QualifierTextCapacity];
    char nameText[zq3NameTextCapacity];
    char longText[zq3LongTextCapacity];
    char noteText[zq3NoteTextCapacity];
    char* commandText;
    textBuffer* tablespaceBuffers;
    char (*names)[nameSize];       // the name block
    uint32_t maxTablespaces;       // slots in it
    nameList* last;                // list of the last entry with names
    nameList* recent[recentLists]; // the last list for each remainder of its hash
    sqlca eventSQLCA;
    zq3HistoryData tempHistData;
};

int sortHistoryEntries(const void* first, const void* second)
{
    auto a = static_cast<const historyEntry*>(first);
    auto b = static_cast<const historyEntry*>(second);
    int order = memcmp(a->timestamp, b->timestamp, timestampLength);
    return order != 0 ? order : static_cast<int>(a->index - b->index);
}

bool isCreateTempspace(char* commandText)
{
    char prefix[commandPrefixLength + 1] = {};
    strncpy(prefix, commandText, commandPrefixLength);
    str2upper(prefix);
    return strncmp(prefix, "CREATE", strlen("CREATE")) == 0 &&
           strstr(prefix, "TEMPORARY TABLESPACE") != nullptr;
}

// Returns null, or the message of the allocation that failed.
static const planMessage* allocateBuffers(scanBuffers* buffers, uint32_t maxTablespaces)
{
    buffers->maxTablespaces = maxTablespaces;
    buffers->commandText = static_cast<char*>(calloc(commandTextCapacity + 1, 1));
    if (buffers->commandText == nullptr)
        return &msgNoMemoryCommandText;

    buffers->tablespaceBuffers =
        static_cast<textBuffer*>(calloc(maxTablespaces, sizeof(textBuffer)));
    if (buffers->tablespaceBuffers == nullptr)
        return &msgNoMemoryBuffers;

    buffers->names = static_cast<char(*)[nameSize]>(calloc(maxTablespaces, nameSize));
    if (buffers->names == nullptr)
        return &msgNoMemoryNameBlock;
    return nullptr;
}

static void freeBuffers(scanBuffers* buffers)
{
    free(buffers->commandText);
    free(buffers->names);
    free(buffers->tablespaceBuffers);
}

// Points the scan record at the buffers.
static void setUpRecord(scanBuffers* buffers)
{
    zq3HistoryData* record = &buffers->tempHistData;
    record->objectPart = {buffers->objectPart, sizeof buffers->objectPart, 0};
    record->secondTimestamp = {buffers->secondTimestamp, sizeof buffers->secondTimestamp, 0};
    record->firstText = {buffers->firstText, sizeof buffers->firstText, 0};
    record->lastText = {buffers->lastText, sizeof buffers->lastText, 0};
    record->idText = {buffers->idText, sizeof buffers->idText, 0};
    record->qualifierText = {buffers->qualifierText, sizeof buffers->qualifierText, 0};
    record->nameText = {buffers->nameText, sizeof buffers->nameText, 0};
    record->longText = {buffers->longText, sizeof buffers->longText, 0};
    record->noteText = {buffers->noteText, sizeof buffers->noteText, 0};
    record->commandText = {buffers->commandText, commandTextCapacity, 0};
    record->eventSqlca = &buffers->eventSQLCA;
    record->tablespaceBuffers = buffers->tablespaceBuffers;
    record->maxTablespaces = buffers->maxTablespaces;
    for (uint32_t i = 0; i < buffers->maxTablespaces; i++)
        buffers->tablespaceBuffers[i] = {buffers->names[i], nameSize, 0};
}

// Of several images with one timestamp, the parts of one backup, only the first counts.
static bool isFirstInSequence(const char* objectPart)
{
    return strnlen(objectPart, objectPartLength) == objectPartLength &&
           strncmp(objectPart + timestampLength, "001", strlen("001")) == 0;
}

static bool isKept(scanBuffers* buffers)
{
    const zq3HistoryData* record = &buffers->tempHistData;
    const char counting[] = {zq3StatusActive, zq3StatusActiveLower, zq3StatusInactive,
                             zq3StatusInactiveLower};
    if (memchr(counting, record->status, sizeof counting) == nullptr ||
        buffers->eventSQLCA.sqlcode < 0)
        return false;

    switch (record->operation) {
    case zq3OperationBackup:
    case zq3OperationRestore:
        return isFirstInSequence(buffers->objectPart);
    case zq3OperationCreate:
        return !isCreateTempspace(buffers->commandText);
    case zq3OperationOther:
    case zq3OperationRename:
        return true;
    default:
        return false;
    }
}

static int growEntries(historyData* data)
{
    if (data->numEntries > INT_MAX - entryGrowth)
        return failStage(msgNoMemoryEntries);

    size_t size = static_cast<size_t>(data->numEntries) + entryGrowth;
    if (size > SIZE_MAX / sizeof(historyEntry))
        return failStage(msgNoMemoryEntries);
    void* grown = realloc(data->entries, size * sizeof(historyEntry));
    if (grown == nullptr)
        return failStage(msgNoMemoryEntries);

    data->entries = static_cast<historyEntry*>(grown);
    memset(static_cast<void*>(data->entries + data->numEntries), 0,
           entryGrowth * sizeof(historyEntry));
    return 0;
}

// Copies the timestamp that a text begins with; target is zero-filled.
static void copyTimestamp(char* target, const char* text)
{
    memcpy(target, text, strnlen(text, timestampLength));
}

static bool hasNames(const nameList* list, const char (*names)[nameSize], uint32_t count)
{
    return list != nullptr && list->count == count &&
           memcmp(list + 1, names, static_cast<size_t>(count) * nameSize) == 0;
}

static uint32_t hashNames(const char (*names)[nameSize], uint32_t count)
{
    uint64_t hash = count;
    for (uint32_t i = 0; i < count; i++) {
        nameKey key = makeNameKey(names[i]);
        hash = (std::rotl(hash, 5) ^ key.head ^ std::rotl(key.middle, 21) ^ key.tail) *
               0x9E3779B97F4A7C15u;
    }
    return static_cast<uint32_t>(hash >> 32);
}

// The list for the names in the first count slots: that of a recent entry where one has the same
// names, else a new one. Null: no memory.
static nameList* listForNames(scanBuffers* buffers, uint32_t count)
{
    if (hasNames(buffers->last, buffers->names, count))
        return buffers->last;

    // What stands after the names in their slots is anything.
    for (uint32_t i = 0; i < count; i++)
        copyName(buffers->names[i], buffers->names[i]);
    nameList** recent = &buffers->recent[hashNames(buffers->names, count) % recentLists];
    if (!hasNames(*recent, buffers->names, count)) {
        nameList* list = makeNameList(buffers->names, count);
        if (list == nullptr)
            return nullptr;
        *recent = list;
    }
    buffers->last = *recent;
    return buffers->last;
}

// Adds the entry in the buffers to the collection; it counts only once it is complete.
static int keepEntry(scanBuffers* buffers, historyData* data)
{
    int rc = data->numEntries % entryGrowth == 0 ? growEntries(data) : 0;
    if (rc != 0)
        return rc;

    const zq3HistoryData* record = &buffers->tempHistData;
    historyEntry* entry = &data->entries[data->numEntries];
    entry->index = static_cast<uint32_t>(data->numEntries);
    copyTimestamp(entry->timestamp, buffers->objectPart);
    if (record->operation == zq3OperationRestore)
        copyTimestamp(entry->backupId, buffers->idText);
    entry->operation = record->operation;
    entry->object = record->object;
    entry->operationType = record->operationType;

    // The record tells how many names the history's entry has; only so many have a slot.
    uint32_t numNames = record->numTablespaces < buffers->maxTablespaces ? record->numTablespaces
                                                                         : buffers->maxTablespaces;
    nameList* list = numNames != 0 ? listForNames(buffers, numNames) : nullptr;
    if (numNames != 0 && list == nullptr)
        return failStage(msgNoMemoryNames);
    giveNames(entry, list);
    entry->numTablespaces = numNames;
    data->numEntries++;
    return 0;
}

// Gets all entries of the open scan. *targetFound: whether the target image is among those kept.
static int readEntries(const historySource* source, const zq3HistoryOpenStruct* scan,
                       const char* timestamp, scanBuffers* buffers, historyData* data,
                       bool* targetFound)
{
    const planMessage* failure = allocateBuffers(buffers, scan->maxTablespaces);
    if (failure != nullptr)
        return failStage(*failure);
    setUpRecord(buffers);

    int rc = 0;
    sqlca ca = {};
    zq3HistoryFetchStruct fetchStruct = {&buffers->tempHistData, scan->handle, 2};
    for (uint32_t row = 0; row < scan->numRows && rc == 0; row++) {
        int result = source->getEntry(source->context, &fetchStruct, &ca);
        if (result != 0 || ca.sqlcode < 0)
            return failScan(msgGetEntry, ca.sqlcode);
        if (!isKept(buffers))
            continue;

        rc = keepEntry(buffers, data);
        if (rc == 0 && timestamp != nullptr &&
            buffers->tempHistData.operation == zq3OperationBackup &&
            strncmp(buffers->objectPart, timestamp, timestampLength) == 0)
            *targetFound = true;
    }
    return rc;
}

// Histories are mostly written in the order of time.
static void sortEntries(historyData* data)
{
    int inOrder = 1;
    while (inOrder < data->numEntries &&
           sortHistoryEntries(&data->entries[inOrder - 1], &data->entries[inOrder]) < 0)
        inOrder++;
    if (inOrder < data->numEntries)
        qsort(data->entries, static_cast<size_t>(data->numEntries), sizeof(historyEntry),
              sortHistoryEntries);
}

// Counts the images up to the target, finds the target and the first rename.
static void locateTarget(historyData* data, const char* timestamp, int* numBackups)
{
    for (int i = 0; i < data->numEntries; i++) {
        const historyEntry* entry = &data->entries[i];
        if (entry->operation == zq3OperationBackup) {
            ++*numBackups;
            if (memcmp(entry->timestamp, timestamp, timestampLength) == 0) {
                data->backupIndex = i;
                return;
            }
        } else if (entry->operation == zq3OperationRename && data->renameIndex == -1) {
            data->renameIndex = i;
        }
    }
}

int fetchFromSource(const historySource* source, const char* timestamp, historyData* data,
                    int* numBackups)
{
    int rc = 0;
    bool targetFound = timestamp == nullptr;
    sqlca ca = {};
    scanBuffers buffers = {};
    zq3HistoryOpenStruct openStruct = {};

    int result = source->openScan(source->context, &openStruct, &ca);
    if (result != 0 || ca.sqlcode < 0)
        rc = failScan(msgOpenScan, ca.sqlcode);
    else if (openStruct.numRows != 0 && openStruct.maxTablespaces != 0)
        rc = readEntries(source, &openStruct, timestamp, &buffers, data, &targetFound);

    if (rc == 0 && targetFound)
        sortEntries(data);
    if (rc == 0 && targetFound && timestamp != nullptr)
        locateTarget(data, timestamp, numBackups);

    source->closeScan(source->context, &openStruct.handle, &ca);
    if (rc == 0 && ca.sqlcode < 0)
        rc = failScan(msgCloseScan, ca.sqlcode);
    if (rc == 0 && !targetFound)
        rc = failStage(msgNoImage, timestamp);

    freeBuffers(&buffers);
    return rc;
}

void showinfo(historyEntry* entry)
{
    printf("                Index: %u\n", entry->index);
    printf("            Timestamp: %s\n", entry->timestamp);
    printf("            Operation: %c\n", entry->operation);
    printf("               Object: %c\n", entry->object);
    printf("       Operation Type: %c\n", entry->operationType);
    printf("            Backup ID: %s\n", entry->backupId);
    printf("Number of Tablespaces: %u\n", entry->numTablespaces);
    for (uint32_t i = 0; i < entry->numTablespaces; i++)
        printf("        Tablespace[%u]: %s\n", i, entry->tablespaceNames[i]);
    printf("\n");
}

void showEntries(historyData* data)
{
    for (int i = 0; i < data->numEntries; i++) {
        showinfo(&data->entries[i]);
        if (i == data->backupIndex)
            printf("===== ENTRIES BELOW IGNORED =====\n\n");
    }
}
