// The timeline matrix: which images hold the tablespaces on the way to the target, and which of
// them a restore needs.
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "history/sqluhist.h"
#include "tool/nameindex.h"
#include "tool/zq3ckrst.h"

int listBackupImages(restorePlan* plan)
{
    plan->images = static_cast<backupImage*>(
        calloc(static_cast<size_t>(plan->numBackups), sizeof(backupImage)));
    if (plan->images == nullptr)
        return failStage(msgNoMemoryImages);

    backupImage* image = plan->images;
    for (int i = 0; i <= plan->histData.backupIndex; i++) {
        const historyEntry* entry = &plan->histData.entries[i];
        if (entry->operation != zq3OperationBackup)
            continue;
        memcpy(image->timestamp, entry->timestamp, timestampLength);
        image->numTablespaces = static_cast<int>(entry->numTablespaces);
        image++;
    }
    return 0;
}

int allocateTimelineMatrix(restorePlan* plan)
{
    size_t rows = static_cast<size_t>(plan->numBackups);
    size_t columns = static_cast<size_t>(plan->numTablespaces);
    if (columns == 0)
        return 0;
    if (rows > SIZE_MAX / columns)
        return failStage(msgNoMemoryMatrix);
    plan->matrix = static_cast<char*>(malloc(rows * columns));
    if (plan->matrix == nullptr)
        return failStage(msgNoMemoryMatrix);
    memset(plan->matrix, cellUnused, rows * columns);
    return 0;
}

// --- The fill pass -------------------------------------------------------------------------------

// After its full image, or its creation, nothing older acts on a tablespace any more.
static bool isComplete(const tablespaceInfo* tablespace)
{
    return tablespace->lastImageType == chainComplete;
}

static char imageLetter(char operationType)
{
    if (sqluhIsHistEntryIncr(operationType))
        return cellIncremental;
    return sqluhIsHistEntryDelta(operationType) ? cellDelta : cellFull;
}

// Lets a backup image that holds the tablespace act on it; rowCells is the image's row. False: the
// image that a restore used is not in the history, since an older one is met already.
static bool visitBackup(tablespaceInfo* tablespace, const historyEntry* entry, char letter,
                        char* rowCells)
{
    if (!tablespace->tracking) {
        int order = memcmp(tablespace->restoredImage, entry->timestamp, timestampLength);
        if (order > 0)
            return false;
        if (order < 0)
            return true; // taken after the restored image: the restore discarded it
        tablespace->tracking = 1;
    }
    rowCells[tablespace->id] = letter;
    tablespace->lastImageType = letter == cellFull ? chainComplete : letter;
    return true;
}

// Lets an entry that lists the tablespace, which is not complete, act on it. What it does a second
// time changes nothing, so a name that an entry lists twice does no harm.
static bool visitEntry(tablespaceInfo* tablespace, historyEntry* entry, char letter, char* rowCells)
{
    if (entry->operation == zq3OperationBackup)
        return visitBackup(tablespace, entry, letter, rowCells);

    if (tablespace->tracking && entry->operation == zq3OperationRestore) {
        tablespace->tracking = 0;
        tablespace->restoredImage = entry->backupId;
    } else if (tablespace->tracking && entry->operation == zq3OperationCreate) {
        tablespace->tracking = 0;
        tablespace->lastImageType = chainComplete;
    }
    return true;
}

// A position on the walk from the target back to the oldest entry.
struct timelineWalk {
    int position;
    historyEntry* entry;
    char* rowCells;  // of the backup image met last
    char letter;     // its kind
    int incomplete;  // columns on which older entries can act
    int firstFailed; // column; -1: none
};

// Goes on to the next older entry that can act on a tablespace. False: there is none.
static bool stepBack(timelineWalk* walk, const historyData* data, int numTablespaces)
{
    while (walk->position > 0) {
        walk->entry = &data->entries[--walk->position];
        switch (walk->entry->operation) {
        case zq3OperationBackup:
            walk->rowCells -= numTablespaces;
            walk->letter = imageLetter(walk->entry->operationType);
            return true;
        case zq3OperationRestore:
        case zq3OperationCreate:
            return true;
        default:
            break;
        }
    }
    return false;
}

// The column of a name, or -1. Most images list the same names in the same order, so *guess, the
// column after the one for the name before, is tried first.
static int findColumn(const tablespaceInfo* list, int numTablespaces, int* guess, const char* name)
{
    int column = *guess;
    if (memcmp(list[column].name, name, nameSize) != 0)
        column = findName(list, static_cast<size_t>(numTablespaces), name);
    int next = (column < 0 ? *guess : column) + 1;
    *guess = next < numTablespaces ? next : 0;
    return column;
}

// Lets the entry act on the columns that it lists. Returns whether older ones can act on any.
static bool visitColumns(timelineWalk* walk, tablespaceInfo* list, int numTablespaces)
{
    bool someIncomplete = false;
    int guess = 0;
    for (uint32_t i = 0; i < walk->entry->numTablespaces; i++) {
        int column = findColumn(list, numTablespaces, &guess, walk->entry->tablespaceNames[i]);
        if (column < 0 || isComplete(&list[column]))
            continue;
        if (!visitEntry(&list[column], walk->entry, walk->letter, walk->rowCells) &&
            (walk->firstFailed < 0 || column < walk->firstFailed))
            walk->firstFailed = column;
        if (isComplete(&list[column]))
            walk->incomplete--;
        else
            someIncomplete = true;
    }
    return someIncomplete;
}

static void startColumns(tablespaceInfo* list, int numTablespaces)
{
    size_t columns = static_cast<size_t>(numTablespaces);
    enterNames(list, columns, columns);
    for (size_t i = 0; i < columns; i++) {
        list[i].tracking = 1;
        list[i].restoredImage = nullptr;
        list[i].lastImageType = cellUnused;
    }
}

int fillColumns(char* matrix, historyData* data, tablespaceInfo* list, int numTablespaces,
                int numBackups)
{
    if (numTablespaces < 1)
        return -1;

    startColumns(list, numTablespaces);
    char* end = matrix + static_cast<size_t>(numBackups) * static_cast<size_t>(numTablespaces);
    timelineWalk walk = {data->backupIndex + 1, nullptr, end, cellUnused, numTablespaces, -1};
    const nameList* settled = nullptr; // its names are of no column, or of complete ones
    while (walk.incomplete > 0 && stepBack(&walk, data, numTablespaces)) {
        const nameList* names = namesOfEntry(walk.entry);
        if (names != nullptr && names != settled && !visitColumns(&walk, list, numTablespaces))
            settled = names;
    }
    return walk.firstFailed;
}

int fillTimelineMatrix(char* matrix, historyData* data, tablespaceInfo* list, int numTablespaces,
                       int numBackups)
{
    int failed = fillColumns(matrix, data, list, numTablespaces, numBackups);
    return failed < 0 ? 0 : failStage(msgMissingImage, list[failed].name);
}

// --- The scan pass -------------------------------------------------------------------------------

// Columns are scanned side by side: a row's cells stand together in memory, a column's do not.
enum : int { columnsAtATime = 1024 };

// The kind of the needed image met last on the way back from the target, and whether older images
// are no longer needed.
struct columnState {
    char state;
    bool clear;
};

// Returns true when the column is settled: everything older is cleared whatever it is.
static bool scanCell(columnState* column, char* cell)
{
    switch (column->state) {
    case cellIncremental:
        column->clear = *cell != cellFull;
        if (*cell == cellFull)
            column->state = cellFull;
        break;
    case cellDelta:
        if (*cell == cellFull || *cell == cellIncremental) {
            column->state = *cell;
            column->clear = false;
        }
        break;
    case cellFull:
        column->clear = true;
        break;
    default:
        column->state = *cell;
        break;
    }
    if (column->clear)
        *cell = cellUnused;
    return column->state == cellFull && column->clear;
}

// Scans up to columnsAtATime columns; matrix points at the first one's cell in row 0. Returns the
// first that does not start with a full image, or -1.
static int scanBlock(char* matrix, size_t rowLength, int width, int numBackups)
{
    columnState columns[columnsAtATime];
    char* cells = matrix + static_cast<size_t>(numBackups - 1) * rowLength;
    for (int i = 0; i < width; i++)
        columns[i] = {cells[i], false};

    int settled = 0;
    for (int row = numBackups - 2; row >= 0; row--) {
        cells -= rowLength;
        if (settled == width) {
            memset(cells, cellUnused, static_cast<size_t>(width));
            continue;
        }
        settled = 0;
        for (int i = 0; i < width; i++)
            settled += scanCell(&columns[i], &cells[i]);
    }

    for (int i = 0; i < width; i++)
        if (columns[i].state != cellFull)
            return i;
    return -1;
}

int scanColumns(char* matrix, int numTablespaces, int numBackups)
{
    int firstFailed = -1;
    for (int column = 0; column < numTablespaces; column += columnsAtATime) {
        int left = numTablespaces - column;
        int failed = scanBlock(matrix + column, static_cast<size_t>(numTablespaces),
                               left < columnsAtATime ? left : columnsAtATime, numBackups);
        if (failed >= 0 && firstFailed < 0)
            firstFailed = column + failed;
    }
    return firstFailed;
}

int scanAndUpdateTimelineMatrix(char* matrix, tablespaceInfo* list, int numTablespaces,
                                int numBackups)
{
    int failed = scanColumns(matrix, numTablespaces, numBackups);
    return failed < 0 ? 0 : failStage(msgMissingFullImage, list[failed].name);
}

// --- The verbose listing -------------------------------------------------------------------------

static void showTimelineHead(const restorePlan* plan, const char* heading)
{
    printf("Num Tablespaces: %d Num Backups: %d\n", plan->numTablespaces, plan->numBackups);
    for (int i = 0; i < plan->numTablespaces; i++)
        printf("Name: %s ID: %.5d Deleted: %d\n", plan->list[i].name, plan->list[i].id,
               plan->list[i].deleted);
    printf("%s", heading);

    if (plan->numBackups > 0) {
        for (int i = 0; i < plan->numTablespaces; i++)
            printf("%.5d ", i);
        printf("\n\n");
    }
}

static void showCells(const restorePlan* plan, int row)
{
    size_t columns = static_cast<size_t>(plan->numTablespaces);
    for (size_t i = 0; i < columns; i++) {
        char text[] = {' ', ' ', plan->matrix[static_cast<size_t>(row) * columns + i],
                       ' ', ' ', ' '};
        fwrite(text, 1, sizeof text, stdout);
    }
}

void showBeginningTimeline(restorePlan* plan)
{
    showTimelineHead(plan, "\nBeginning Timeline:\n\n");
    for (int row = 0; row < plan->numBackups; row++) {
        showCells(plan, row);
        printf("\t%s\n", plan->images[row].timestamp);
    }
    putchar('\n');
}

void showNewTimeline(restorePlan* plan)
{
    showTimelineHead(plan, "\nNew Timeline:\n\n");
    for (int row = 0; row < plan->numBackups; row++) {
        showCells(plan, row);
        printf("\t%s < %d\n", plan->images[row].timestamp, plan->images[row].numTablespaces);
    }
    putchar('\n');
}
