// Reading a history for questions about its images, and planning with the planner's own stages.
#include "admin/catalog.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "zq3.h"

// --- Reading -------------------------------------------------------------------------------------

// A read of the history, which the planner takes its entries from; on the way past what the catalog
// wants of each is noted.
struct catalogRead {
    imageCatalog* catalog;
    SQLUH_COMMITTED* history;
    uint32_t nextRow;
    uint32_t* lastNumbers; // of the entries, by their node
};

static int openRead(void* context, zq3HistoryOpenStruct* open, sqlca*)
{
    catalogRead* read = static_cast<catalogRead*>(context);
    open->numRows = read->history->numRows;
    open->maxTablespaces = read->history->maxTablespaces;
    return 0;
}

static bool isInactive(char status)
{
    return status == zq3StatusInactive || status == zq3StatusInactiveLower;
}

static bool isActive(char status)
{
    return status == zq3StatusActive || status == zq3StatusActiveLower || isInactive(status);
}

static void noteGap(catalogRead* read, const zq3HistoryData* record)
{
    imageCatalog* catalog = read->catalog;
    uint32_t* last = &read->lastNumbers[record->entryNode];
    // A node's first entry in the history follows nothing.
    if (*last != 0 && record->entryNumber > *last && record->entryNumber - *last > 1)
        catalog->gaps[catalog->numGaps++] = {*last + 1, record->entryNumber - 1};
    *last = record->entryNumber;
}

// Notes a backup image that the planner passes over because it failed or was given up.
static void noteUnused(imageCatalog* catalog, const zq3HistoryData* record)
{
    const char* objectPart = record->objectPart.data;
    if (record->operation != zq3OperationBackup ||
        strlen(objectPart) != zq3ObjectPartCapacity - 1 ||
        strcmp(objectPart + timestampLength, "001") != 0 ||
        (record->eventSqlca->sqlcode >= 0 && isActive(record->status)))
        return;
    unusedImage* unused = &catalog->unused[catalog->numUnused++];
    *unused = {};
    unused->sqlcode = record->eventSqlca->sqlcode;
    unused->status = record->status;
    unused->image.index = static_cast<uint32_t>(catalog->history.numEntries);
    memcpy(unused->image.timestamp, objectPart, timestampLength);
    unused->image.object = record->object;
    unused->image.operationType = record->operationType;
    unused->image.numTablespaces = record->numTablespaces;
}

static int getRow(void* context, zq3HistoryFetchStruct* fetch, sqlca* ca)
{
    catalogRead* read = static_cast<catalogRead*>(context);
    imageCatalog* catalog = read->catalog;
    const zq3HistoryData* record = fetch->historyRecord;
    SQLUH_ENTRY entry = {};
    entry.data = fetch->historyRecord;
    ca->sqlcode = sqluhGetCommitted(read->history, read->nextRow++, &entry, false);
    if (ca->sqlcode < 0)
        return ca->sqlcode;
    noteGap(read, record);
    noteUnused(catalog, record);
    // The next entry that is kept has this index, and those passed over before it are noted here.
    catalog->facts[catalog->history.numEntries] = {catalog->numGaps, isInactive(record->status)};
    return 0;
}

static int closeRead(void*, uint16_t*, sqlca*)
{
    return 0;
}

static bool allocateFacts(catalogRead* read)
{
    imageCatalog* catalog = read->catalog;
    size_t count = static_cast<size_t>(read->history->numRows) + 1;
    catalog->facts = static_cast<entryFacts*>(reallocarray(nullptr, count, sizeof(entryFacts)));
    catalog->gaps = static_cast<numberGap*>(reallocarray(nullptr, count, sizeof(numberGap)));
    catalog->unused = static_cast<unusedImage*>(reallocarray(nullptr, count, sizeof(unusedImage)));
    read->lastNumbers = static_cast<uint32_t*>(calloc(UINT16_MAX + 1, sizeof(uint32_t)));
    return catalog->facts != nullptr && catalog->gaps != nullptr && catalog->unused != nullptr &&
           read->lastNumbers != nullptr;
}

static int orderOfUnused(const void* first, const void* second)
{
    return sortHistoryEntries(&static_cast<const unusedImage*>(first)->image,
                              &static_cast<const unusedImage*>(second)->image);
}

// Takes the entries that matter, and notes what the planner does not keep.
static int takeEntries(const historyPlace* place, SQLUH_COMMITTED* history, imageCatalog* catalog)
{
    catalogRead read = {catalog, history, 0, nullptr};
    const historySource source = {&read, openRead, getRow, closeRead};
    int numBackups = 0;
    int rc = 0;
    catalog->numEntries = history->numRows;
    catalog->isCut = history->numRows < history->header.entryCount;
    if (!allocateFacts(&read) ||
        fetchFromSource(&source, nullptr, &catalog->history, &numBackups) != 0)
        rc = failWithCode(sqloSystemError | ENOMEM, "read the history", place->directory);
    if (rc == 0)
        qsort(catalog->unused, static_cast<size_t>(catalog->numUnused), sizeof(unusedImage),
              orderOfUnused);
    free(read.lastNumbers);
    return rc;
}

static int orderOfTimestamps(const void* first, const void* second)
{
    return memcmp(first, second, timestampLength);
}

// Makes room for one more in the list of images on hand.
static int growOnHand(imageCatalog* catalog, const char* name)
{
    size_t count = catalog->numOnHand;
    if ((count & (count + 1)) != 0)
        return 0; // there is room up to one less than a power of two
    void* grown = reallocarray(catalog->onHand, count * 2 + 2, sizeof *catalog->onHand);
    if (grown == nullptr)
        return failWithCode(sqloSystemError | ENOMEM, "read the list of images", name);
    catalog->onHand = static_cast<char(*)[timestampLength + 1]>(grown);
    return 0;
}

// Takes one line of the list of images on hand: a timestamp, a comment, or nothing.
static int takeOnHand(imageCatalog* catalog, const char* name, int number, char* line)
{
    char* text = line + strspn(line, " \t");
    text[strcspn(text, "\r\n")] = '\0';
    for (size_t length = strlen(text); length > 0 && strchr(" \t", text[length - 1]); length--)
        text[length - 1] = '\0';
    if (text[0] == '\0' || text[0] == '#')
        return 0;
    if (growOnHand(catalog, name) != 0)
        return exitFailed;
    if (!parseTimestamp(text, catalog->onHand[catalog->numOnHand]))
        return fail(name, "found \"%.40s\" in line %d but expected a timestamp", text, number);
    catalog->numOnHand++;
    return 0;
}

static int readOnHand(imageCatalog* catalog, const char* name)
{
    bool isInput = strcmp(name, "-") == 0;
    const char* title = isInput ? "standard input" : name;
    FILE* in = isInput ? stdin : fopen(name, "re");
    if (in == nullptr)
        return failWithCode(sqloSystemError | errno, "read the list of images", title);
    char* line = nullptr;
    size_t capacity = 0;
    int rc = growOnHand(catalog, title); // an empty list is one, too
    for (int number = 1; rc == 0 && getline(&line, &capacity, in) >= 0; number++)
        rc = takeOnHand(catalog, title, number, line);
    if (rc == 0 && ferror(in))
        rc = failWithCode(sqloSystemError | errno, "read the list of images", title);
    if (catalog->onHand != nullptr)
        qsort(catalog->onHand, catalog->numOnHand, sizeof *catalog->onHand, orderOfTimestamps);
    free(line);
    if (!isInput)
        fclose(in);
    return rc;
}

int readCatalog(const historyPlace* place, const char* have, imageCatalog* catalog)
{
    SQLUH_COMMITTED* history = nullptr;
    int rc = readCommitted(place, &history);
    if (rc == 0 && history->failure != 0) {
        rc = failDamaged(place, history, "read the history");
        sqluhFreeCommitted(&history);
    }
    return rc != 0 ? rc : fillCatalog(place, history, have, catalog);
}

int fillCatalog(const historyPlace* place, SQLUH_COMMITTED* history, const char* have,
                imageCatalog* catalog)
{
    *catalog = {};
    catalog->history.backupIndex = catalog->history.renameIndex = -1;
    int rc = have != nullptr ? readOnHand(catalog, have) : 0;
    if (rc == 0)
        rc = takeEntries(place, history, catalog);
    sqluhFreeCommitted(&history);
    const historyEntry *image = nullptr, *rename = nullptr;
    for (int i = catalog->history.numEntries - 1; i >= 0; i--) {
        const historyEntry* entry = &catalog->history.entries[i];
        image = isImage(entry) ? entry : image;
        rename = entry->operation == zq3OperationRename ? entry : rename;
    }
    catalog->renamesCount = image != nullptr && rename != nullptr &&
                            orderOfTimestamps(rename->timestamp, image->timestamp) >= 0;
    return rc;
}

void freeCatalog(imageCatalog* catalog)
{
    restorePlan all = {};
    all.histData = catalog->history;
    freePlan(&all);
    free(catalog->facts);
    free(catalog->gaps);
    free(catalog->unused);
    free(catalog->onHand);
    *catalog = {};
}

// --- Images --------------------------------------------------------------------------------------

bool isImage(const historyEntry* entry)
{
    return entry->operation == zq3OperationBackup;
}

bool isOnHand(const imageCatalog* catalog, const historyEntry* image)
{
    return catalog->onHand == nullptr ||
           bsearch(image->timestamp, catalog->onHand, catalog->numOnHand, sizeof *catalog->onHand,
                   orderOfTimestamps) != nullptr;
}

const char* kindOfImage(const historyEntry* image)
{
    return sqluhIsHistEntryIncr(image->operationType)    ? "incremental"
           : sqluhIsHistEntryDelta(image->operationType) ? "delta"
                                                         : "full";
}

const char* scopeOfImage(const historyEntry* image)
{
    return image->object == zq3ObjectTablespace ? "tablespace" : "database";
}

int findImage(const imageCatalog* catalog, const char* timestamp)
{
    for (int i = 0; i < catalog->history.numEntries; i++)
        if (isImage(&catalog->history.entries[i]) &&
            orderOfTimestamps(catalog->history.entries[i].timestamp, timestamp) == 0)
            return i;
    return -1;
}

int newestImage(const imageCatalog* catalog)
{
    int i = catalog->history.numEntries - 1;
    while (i >= 0 && !isImage(&catalog->history.entries[i]))
        i--;
    return i;
}

int failNoImage(const historyPlace* place, const imageCatalog* catalog, const char* timestamp)
{
    const unusedImage* unused = nullptr;
    for (int i = 0; i < catalog->numUnused; i++)
        if (strcmp(catalog->unused[i].image.timestamp, timestamp) == 0)
            unused = &catalog->unused[i];
    if (unused == nullptr)
        fail(place->directory, "no image has the timestamp %s", timestamp);
    else
        fail(place->directory, "the image %s %s", timestamp,
             unused->sqlcode < 0 ? "failed" : "is not active");
    hint(place, unused == nullptr ? "zq3hist images DIR  # lists all"
                                  : "zq3hist images --all DIR  # also lists those that failed");
    return exitNoImage;
}

const numberGap* gapBetween(const imageCatalog* catalog, int oldest, int newest)
{
    if (catalog->facts == nullptr)
        return nullptr;
    int before = catalog->facts[catalog->history.entries[oldest].index].numGaps;
    int after = catalog->facts[catalog->history.entries[newest].index].numGaps;
    return after > before ? &catalog->gaps[before] : nullptr;
}

void describeGap(const numberGap* gap, char* text)
{
    if (gap->first == gap->last)
        snprintf(text, gapCapacity, "entry %u", gap->first);
    else
        snprintf(text, gapCapacity, "entries %u to %u", gap->first, gap->last);
}

void describeLack(const char* image, char* text)
{
    if (image == nullptr)
        snprintf(text, lackCapacity, "a full image");
    else if (image[0] == '\0')
        snprintf(text, lackCapacity, "the image that a restore used, which has no name");
    else
        snprintf(text, lackCapacity, "the image %s", image);
}

// --- Planning ------------------------------------------------------------------------------------

static int listRows(imagePlan* plan)
{
    restorePlan* stages = &plan->stages;
    plan->rows = static_cast<const historyEntry**>(
        reallocarray(nullptr, static_cast<size_t>(stages->numBackups), sizeof *plan->rows));
    if (plan->rows == nullptr)
        return failStage(msgNoMemoryImages);
    const historyEntry* entry = stages->histData.entries;
    for (int row = 0; row < stages->numBackups; entry++)
        if (isImage(entry))
            plan->rows[row++] = entry;
    return 0;
}

static void countPlan(const imageCatalog* catalog, imagePlan* plan)
{
    const char* image;
    for (int row = 0; row < plan->stages.numBackups; row++)
        plan->numImages += isNeeded(plan, row);
    for (int column = 0; column < plan->stages.numTablespaces; column++)
        plan->numIncomplete += lackOfColumn(catalog, plan, column, &image) != planLacksNothing;
}

int planImage(imageCatalog* catalog, int target, char** names, int numNames, imagePlan* plan)
{
    *plan = {};
    restorePlan* stages = &plan->stages;
    historyData* history = &stages->histData;
    *history = catalog->history;
    history->backupIndex = target;
    for (int i = 0; i <= target; i++) {
        stages->numBackups += isImage(&history->entries[i]);
        if (history->renameIndex < 0 && history->entries[i].operation == zq3OperationRename)
            history->renameIndex = i;
    }
    int rc = catalog->renamesCount ? updateHistoryEntriesforRename(history) : 0;
    if (rc == 0)
        rc = numNames == 0 ? listTargetTablespaces(stages)
                           : listNamedTablespaces(stages, names, numNames);
    if (rc == 0)
        rc = listRows(plan);
    if (rc == 0)
        rc = allocateTimelineMatrix(stages);
    if (rc != 0)
        return failWithCode(sqloSystemError | ENOMEM, "plan the restore",
                            history->entries[target].timestamp);
    fillColumns(stages->matrix, history, stages->list, stages->numTablespaces, stages->numBackups);
    scanColumns(stages->matrix, stages->numTablespaces, stages->numBackups);
    countPlan(catalog, plan);
    return 0;
}

void freeImagePlan(imagePlan* plan)
{
    free(plan->rows);
    plan->stages.histData = {}; // the catalog's
    freePlan(&plan->stages);
    *plan = {};
}

// --- Cells ---------------------------------------------------------------------------------------

char cellAt(const imagePlan* plan, int row, int column)
{
    size_t columns = static_cast<size_t>(plan->stages.numTablespaces);
    return plan->stages.matrix[static_cast<size_t>(row) * columns + static_cast<size_t>(column)];
}

bool isNeeded(const imagePlan* plan, int row)
{
    return countNeeded(plan, row) != 0 || plan->rows[row]->numTablespaces == 0;
}

int countNeeded(const imagePlan* plan, int row)
{
    int count = 0;
    for (int column = 0; column < plan->stages.numTablespaces; column++)
        count += cellAt(plan, row, column) != cellUnused;
    return count;
}

planLack lackOfColumn(const imageCatalog* catalog, const imagePlan* plan, int column,
                      const char** image)
{
    const tablespaceInfo* tablespace = &plan->stages.list[column];
    bool hasFull = false;
    *image = nullptr;
    for (int row = plan->stages.numBackups - 1; row >= 0; row--) {
        char cell = cellAt(plan, row, column);
        hasFull = hasFull || cell == cellFull;
        if (cell != cellUnused && !isOnHand(catalog, plan->rows[row])) {
            *image = plan->rows[row]->timestamp;
            return planLacksOnHand;
        }
    }
    if (hasFull)
        return planLacksNothing;
    if (tablespace->tracking || tablespace->lastImageType == chainComplete)
        return planLacksFullImage;
    *image = tablespace->restoredImage;
    return planLacksRestored;
}
