// Planning with the planner's own stages, so that its plans and these cannot differ.
#include "admin/catalog.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <unistd.h>

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
        hint(place, "zq3hist verify DIR may tell more");
    }
    unlink(link);
    rmdir(folder);
    free(path);
    return rc;
}

bool isImage(const historyEntry* entry)
{
    return entry->operation == 'B';
}

int readCatalog(historyPlace* place, imageCatalog* catalog)
{
    *catalog = {};
    catalog->oldestImage = catalog->firstRename = -1;
    catalog->history.backupIndex = catalog->history.renameIndex = -1;
    int rc = awaitLock(place, R_OK);
    if (rc == 0)
        rc = fetchThroughFolder(place, &catalog->history);
    releaseSignals();
    for (int i = catalog->history.numEntries - 1; i >= 0; i--) {
        if (isImage(&catalog->history.entries[i]))
            catalog->oldestImage = i;
        if (catalog->history.entries[i].operation == 'N')
            catalog->firstRename = i;
    }
    catalog->renamedUpTo = catalog->firstRename;
    return rc;
}

void freeCatalog(imageCatalog* catalog)
{
    restorePlan all = {};
    all.histData = catalog->history;
    freePlan(&all);
    *catalog = {};
}

const char* kindOfImage(const historyEntry* image)
{
    return sqluhIsHistEntryIncr(image->operationType)    ? "incremental"
           : sqluhIsHistEntryDelta(image->operationType) ? "delta"
                                                         : "full";
}

const char* scopeOfImage(const historyEntry* image)
{
    return image->object == 'P' ? "tablespace" : "database";
}

// --- Planning ------------------------------------------------------------------------------------

// Applies the renames that lie before the target and were not applied for an earlier one. They act
// from the oldest to the newest, so that they can be applied in several goes.
static int applyRenames(imageCatalog* catalog, int target)
{
    int rc = 0;
    restorePlan due = {};
    backupImage oldest = {};
    if (catalog->firstRename < 0 || catalog->renamedUpTo >= target)
        return 0;
    memcpy(oldest.timestamp, catalog->history.entries[catalog->oldestImage].timestamp,
           timestampLength);
    due.images = &oldest;
    due.histData = catalog->history;
    due.histData.renameIndex = catalog->firstRename;
    if (isRenamePassDue(&due)) {
        due.histData.renameIndex = catalog->renamedUpTo;
        due.histData.backupIndex = target;
        rc = updateHistoryEntriesforRename(&due.histData);
    }
    if (rc == 0)
        catalog->renamedUpTo = target;
    return rc;
}

// Sets the plan on the entries from first to the target.
static void viewEntries(const imageCatalog* catalog, int target, int first, imagePlan* plan)
{
    plan->firstEntry = first;
    plan->stages.histData.entries = catalog->history.entries + first;
    plan->stages.histData.numEntries = target - first + 1;
    plan->stages.histData.backupIndex = target - first;
    plan->stages.histData.renameIndex = -1;
    plan->stages.numBackups = 0;
    for (int i = first; i <= target; i++)
        plan->stages.numBackups += isImage(&catalog->history.entries[i]);
}

static bool allComplete(const restorePlan* stages)
{
    for (int i = 0; i < stages->numTablespaces; i++)
        if (stages->list[i].lastImageType != chainComplete)
            return false;
    return true;
}

// Fills and prunes the matrix. Most chains are short, so the plan begins with the entries just
// before the target and takes older ones only while a chain is open: what an image costs does not
// grow with the history.
static int fillPlan(const imageCatalog* catalog, int target, bool allRows, imagePlan* plan)
{
    restorePlan* stages = &plan->stages;
    int first = target;
    int rc = 0;
    for (int reach = allRows ? target : 32;
         rc == 0 && (stages->matrix == nullptr || !allComplete(stages)); reach *= 2) {
        if (stages->matrix != nullptr && first == 0)
            break;
        free(stages->matrix);
        stages->matrix = nullptr;
        first = reach > 0 && reach < target ? target - reach : 0;
        viewEntries(catalog, target, first, plan);
        rc = allocateTimelineMatrix(stages);
        if (rc == 0 && stages->numTablespaces == 0)
            break;
        if (rc == 0)
            fillColumns(stages->matrix, &stages->histData, stages->list, stages->numTablespaces,
                        stages->numBackups);
    }
    if (rc == 0)
        scanColumns(stages->matrix, stages->numTablespaces, stages->numBackups);
    return rc;
}

// Counts the images without tablespaces up to the target: the planner puts them into every plan.
static int countEmptyImages(imageCatalog* catalog, int target)
{
    for (; catalog->countedUpTo <= target; catalog->countedUpTo++) {
        const historyEntry* entry = &catalog->history.entries[catalog->countedUpTo];
        catalog->numEmptyImages += isImage(entry) && entry->numTablespaces == 0;
    }
    return catalog->numEmptyImages;
}

static int listRows(imagePlan* plan)
{
    plan->rows = static_cast<const historyEntry**>(
        reallocarray(nullptr, static_cast<size_t>(plan->stages.numBackups), sizeof *plan->rows));
    if (plan->rows == nullptr)
        return reportError(msgNoMemoryImages);
    const historyEntry* entry = plan->stages.histData.entries;
    for (int row = 0; row < plan->stages.numBackups; entry++)
        if (isImage(entry))
            plan->rows[row++] = entry;
    return 0;
}

int planImage(imageCatalog* catalog, int target, const planScope* scope, imagePlan* plan)
{
    *plan = {};
    int rc = applyRenames(catalog, target);
    viewEntries(catalog, target, target, plan);
    if (rc == 0)
        rc = scope->numNames == 0
                 ? listTargetTablespaces(&plan->stages)
                 : listNamedTablespaces(&plan->stages, scope->names, scope->numNames);
    if (rc == 0)
        rc = fillPlan(catalog, target, scope->allRows, plan);
    if (rc == 0)
        rc = listRows(plan);
    if (rc != 0)
        return exitFailed; // the stage has told
    const char* image;
    plan->numImages = countEmptyImages(catalog, target);
    for (int row = 0; row < plan->stages.numBackups; row++)
        plan->numImages += countNeeded(plan, row) != 0;
    for (int column = 0; column < plan->stages.numTablespaces; column++)
        plan->numIncomplete += !isChainComplete(plan, column, &image);
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

const historyEntry* imageOfRow(const imagePlan* plan, int row)
{
    return plan->rows[row];
}

char cellAt(const imagePlan* plan, int row, int column)
{
    size_t columns = static_cast<size_t>(plan->stages.numTablespaces);
    return plan->stages.matrix[static_cast<size_t>(row) * columns + static_cast<size_t>(column)];
}

bool isNeeded(const imagePlan* plan, int row)
{
    return countNeeded(plan, row) != 0 || imageOfRow(plan, row)->numTablespaces == 0;
}

int countNeeded(const imagePlan* plan, int row)
{
    int count = 0;
    for (int column = 0; column < plan->stages.numTablespaces; column++)
        count += cellAt(plan, row, column) != cellUnused;
    return count;
}

bool isChainComplete(const imagePlan* plan, int column, const char** image)
{
    const tablespaceInfo* tablespace = &plan->stages.list[column];
    *image = nullptr;
    for (int row = 0; row < plan->stages.numBackups; row++)
        if (cellAt(plan, row, column) == cellFull)
            return true;
    if (!tablespace->tracking && tablespace->lastImageType != chainComplete)
        *image = tablespace->restoredImage;
    return false;
}
