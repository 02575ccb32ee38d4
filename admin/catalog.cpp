// Reading a history for questions about its images, and planning with the planner's own stages.
#include "admin/catalog.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

#include "zq3.h"

// --- Reading -------------------------------------------------------------------------------------

#define CATALOG_ALIAS "HISTORY"

// The planner knows histories by alias, in the folder of databases: it is shown a folder that has
// this one history under a plain name.
static int fetchThroughFolder(const historyPlace* place, historyData* history)
{
    char folder[pathCapacity];
    char link[sizeof folder + sizeof "/" CATALOG_ALIAS];
    const char* temporary = getenv("TMPDIR");
    char alias[] = CATALOG_ALIAS;
    int numBackups = 0;
    snprintf(folder, sizeof folder, "%s/zq3histXXXXXX",
             temporary != nullptr && temporary[0] != '\0' ? temporary : "/tmp");
    char* path = realpath(place->directory, nullptr);
    if (path == nullptr || mkdtemp(folder) == nullptr) {
        int failed = errno;
        free(path);
        return failWithCode(sqloSystemError | failed, "read the history", place->directory);
    }
    snprintf(link, sizeof link, "%s/" CATALOG_ALIAS, folder);
    int rc = symlink(path, link) == 0 && setenv("ZQ3DBPATH", folder, 1) == 0
                 ? 0
                 : failWithCode(sqloSystemError | errno, "read the history", place->directory);
    if (rc == 0 && fetchHistoryEntries(alias, nullptr, history, &numBackups) != 0) {
        rc = fail(place->directory, "cannot read the history");
        hint(place, "zq3hist verify DIR  # may tell more");
    }
    unlink(link);
    rmdir(folder);
    free(path);
    return rc;
}

static int orderOfTimestamps(const void* first, const void* second)
{
    return memcmp(first, second, timestampLength);
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
    if ((catalog->numOnHand & (catalog->numOnHand + 1)) == 0) { // one less than a power of two
        void* grown =
            reallocarray(catalog->onHand, catalog->numOnHand * 2 + 2, sizeof *catalog->onHand);
        if (grown == nullptr)
            return failWithCode(sqloSystemError | ENOMEM, "read the list of images", name);
        catalog->onHand = static_cast<char(*)[timestampLength + 1]>(grown);
    }
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
    // An empty list is one, too.
    catalog->onHand = static_cast<char(*)[timestampLength + 1]>(malloc(sizeof *catalog->onHand));
    char* line = nullptr;
    size_t capacity = 0;
    int rc = catalog->onHand != nullptr
                 ? 0
                 : failWithCode(sqloSystemError | ENOMEM, "read the list of images", title);
    for (int number = 1; rc == 0 && getline(&line, &capacity, in) >= 0; number++)
        rc = takeOnHand(catalog, title, number, line);
    if (rc == 0 && ferror(in))
        rc = failWithCode(sqloSystemError | errno, "read the list of images", title);
    if (rc == 0)
        qsort(catalog->onHand, catalog->numOnHand, sizeof *catalog->onHand, orderOfTimestamps);
    free(line);
    if (!isInput)
        fclose(in);
    return rc;
}

int readCatalog(historyPlace* place, const char* have, imageCatalog* catalog)
{
    *catalog = {};
    catalog->history.backupIndex = catalog->history.renameIndex = -1;
    int rc = have != nullptr ? readOnHand(catalog, have) : 0;
    if (rc == 0)
        rc = awaitLock(place, R_OK);
    if (rc == 0)
        rc = fetchThroughFolder(place, &catalog->history);
    releaseSignals();
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

int failNoImage(const historyPlace* place, const char* timestamp)
{
    fail(place->directory, "no image has the timestamp %s", timestamp);
    hint(place, "zq3hist images DIR  # lists all");
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

// Says what a stage has to say.
static int failPlanning(const char* timestamp)
{
    return lastFailure.message->code == outOfMemory
               ? failWithCode(sqloSystemError | ENOMEM, "plan the restore", timestamp)
               : fail(timestamp, "the image holds none of the tablespaces");
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
        return failPlanning(history->entries[target].timestamp);
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
