// The chart as a model: its columns, the cells of each tablespace, equal rows as one, and what they
// are called.
#include "admin/chart.h"

#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "zq3.h"

// --- Cells ---------------------------------------------------------------------------------------

char kindOfCell(char cell)
{
    return static_cast<char>(toupper(cell));
}

const char* wordsForCell(char cell)
{
    switch (cell) {
    case chartFull:
        return "full, needed";
    case chartIncremental:
        return "incremental, needed";
    case chartDelta:
        return "delta, needed";
    case chartDiscarded:
        return "discarded";
    case chartMissing:
        return "missing";
    default:
        return "not needed";
    }
}

const char* timestampOfColumn(const chartColumn* column)
{
    return column->image != nullptr ? column->image->timestamp : column->missing;
}

// --- Columns -------------------------------------------------------------------------------------

// An image that is missing, and the position of the image whose column it stands before.
struct missingImage {
    const char* timestamp;
    int before;
};

struct chartBuilder {
    imageChart* chart;
    missingImage* missing; // one for each tablespace; before is -1 where nothing is missing
    int* columnOf;         // by position
    bool* awaited;         // by position: a missing image's column stands before it
    bool* needed;          // by link
    bool* lineage;         // by link: the tablespace goes back to it
};

// The image of a missing one's column: the first later one, or the oldest that the chain has.
static missingImage placeMissing(const chainWalk* walk, int lack, int oldest)
{
    missingImage missing = {nullptr, oldest};
    if (lack > lacksRestored)
        return missing;
    missing.timestamp = walk->history->entries[lacksRestored - lack].backupId;
    missing.before = 0;
    while (missing.before < oldest &&
           (!isImage(&walk->history->entries[missing.before]) ||
            strcmp(walk->history->entries[missing.before].timestamp, missing.timestamp) <= 0))
        missing.before++;
    return missing;
}

// Marks what a link needs, and what is missing for its tablespace.
static void markChain(chartBuilder* builder, int link)
{
    const chainWalk* walk = &builder->chart->walk;
    int lack = walk->links[link].lack;
    int oldest = link;
    for (int at = link; at >= 0; at = nextNeeded(walk, at)) {
        builder->needed[at] = true;
        oldest = at;
    }
    if (lack != lacksNothing)
        builder->missing[walk->links[link].tablespace] =
            placeMissing(walk, lack, walk->links[oldest].image);
}

static void markNeededChains(chartBuilder* builder)
{
    const imageChart* chart = builder->chart;
    const chainWalk* walk = &chart->walk;
    if (chart->target >= 0) {
        const imageChains* chains = &walk->images[chart->target];
        for (int i = 0; i < chains->numLinks; i++)
            markChain(builder, chains->firstLink + i);
        return;
    }
    for (int i = 0; i < walk->numTablespaces; i++)
        if (isAlive(walk, i))
            markChain(builder, walk->tablespaces[i].head);
}

static bool isSameMissing(const chartColumn* column, const missingImage* missing)
{
    return column->image == nullptr &&
           (column->missing == missing->timestamp ||
            (column->missing != nullptr && missing->timestamp != nullptr &&
             strcmp(column->missing, missing->timestamp) == 0));
}

// The column of a missing image: to the left of that of the image it stands before. -1: not yet
// there.
static int findMissing(const chartBuilder* builder, const missingImage* missing, int end)
{
    for (int at = end - 1; at >= 0 && builder->chart->columns[at].image == nullptr; at--)
        if (isSameMissing(&builder->chart->columns[at], missing))
            return at;
    return -1;
}

static void addMissing(chartBuilder* builder, int position)
{
    imageChart* chart = builder->chart;
    for (int i = 0; i < chart->walk.numTablespaces; i++) {
        const missingImage* missing = &builder->missing[i];
        if (missing->before == position && findMissing(builder, missing, chart->numColumns) < 0)
            chart->columns[chart->numColumns++] = {nullptr, missing->timestamp, true};
    }
}

static void listColumns(chartBuilder* builder, int last)
{
    imageChart* chart = builder->chart;
    const historyEntry* entries = chart->walk.history->entries;
    bool* awaited = builder->awaited;
    for (int i = 0; i < chart->walk.numTablespaces; i++)
        if (builder->missing[i].before >= 0)
            awaited[builder->missing[i].before] = true;
    for (int i = 0; i <= last; i++) {
        if (awaited[i])
            addMissing(builder, i);
        builder->columnOf[i] = chart->numColumns;
        if (isImage(&entries[i])) // every plan has one without tablespaces
            chart->columns[chart->numColumns++] = {&entries[i], nullptr,
                                                   chart->walk.images[i].numLinks == 0};
    }
}

// --- Rows ----------------------------------------------------------------------------------------

static char* cellOf(const imageChart* chart, int tablespace, int column)
{
    return chart->cells + static_cast<size_t>(tablespace) * static_cast<size_t>(chart->numColumns) +
           column;
}

// Marks what the tablespaces came from; what is not marked was given up.
static void markLineage(const chainWalk* walk, bool* lineage)
{
    for (int i = 0; i < walk->numTablespaces; i++)
        for (int at = walk->tablespaces[i].head; at >= 0; at = walk->links[at].parent)
            lineage[at] = true;
}

static void fillCells(chartBuilder* builder)
{
    imageChart* chart = builder->chart;
    const chainWalk* walk = &chart->walk;
    for (int i = 0; i < walk->numLinks; i++) {
        const chainLink* link = &walk->links[i];
        const historyEntry* image = &walk->history->entries[link->image];
        char letter = sqluhIsHistEntryIncr(image->operationType)    ? chartIncremental
                      : sqluhIsHistEntryDelta(image->operationType) ? chartDelta
                                                                    : chartFull;
        int column = builder->columnOf[link->image];
        char* cell = cellOf(chart, link->tablespace, column);
        if (builder->needed[i])
            *cell = letter;
        else
            *cell = builder->lineage[i] ? static_cast<char>(tolower(letter)) : char{chartDiscarded};
        chart->columns[column].needed = chart->columns[column].needed || builder->needed[i];
    }
    for (int i = 0; i < walk->numTablespaces; i++)
        if (builder->missing[i].before >= 0)
            *cellOf(chart, i,
                    findMissing(builder, &builder->missing[i],
                                builder->columnOf[builder->missing[i].before])) = chartMissing;
}

// Whether two tablespaces have equal cells in the columns that count.
static bool isEqual(const imageChart* chart, const int* columns, int numColumns, const char* a,
                    const char* b)
{
    if (columns == nullptr)
        return memcmp(a, b, static_cast<size_t>(chart->numColumns)) == 0;
    for (int i = 0; i < numColumns; i++)
        if (columns[i] >= 0 && a[columns[i]] != b[columns[i]])
            return false;
    return true;
}

static bool holdsSomething(const int* columns, int numColumns, const char* cells)
{
    for (int i = 0; i < numColumns; i++) {
        int column = columns == nullptr ? i : columns[i];
        if (column >= 0 && cells[column] != chartNothing)
            return true;
    }
    return false;
}

// Puts the only row of several tablespaces, "the others", after the others.
static void moveOthersLast(imageChart* chart)
{
    int at = 0, end = chart->numRows - 1;
    while (chart->rows[at].count == 1)
        at++;
    chartRow others = chart->rows[at];
    memmove(&chart->rows[at], &chart->rows[at + 1], static_cast<size_t>(end - at) * sizeof others);
    chart->rows[end] = others;
    for (int i = 0; i < chart->walk.numTablespaces; i++)
        chart->rowOf[i] = chart->rowOf[i] == at ? end : chart->rowOf[i] - (chart->rowOf[i] > at);
}

void groupRows(imageChart* chart, const int* columns, int numColumns)
{
    chart->numRows = chart->numRowsOfSeveral = 0;
    for (int i = 0; i < chart->walk.numTablespaces; i++) {
        const char* cells = cellOf(chart, i, 0);
        int row = 0;
        chart->rowOf[i] = -1;
        if (chart->walk.tablespaces[i].name[0] == '\0' ||
            !holdsSomething(columns, numColumns, cells))
            continue;
        while (row < chart->numRows &&
               !isEqual(chart, columns, numColumns, chart->rows[row].cells, cells))
            row++;
        if (row == chart->numRows)
            chart->rows[chart->numRows++] = {i, 0, cells};
        chart->numRowsOfSeveral += ++chart->rows[row].count == 2;
        chart->rowOf[i] = row;
    }
    if (chart->numRowsOfSeveral == 1)
        moveOthersLast(chart);
}

void titleOfRow(const imageChart* chart, const chartRow* row, char* text)
{
    const char* name = chart->walk.tablespaces[row->first].name;
    if (row->count == 1)
        snprintf(text, rowTitleCapacity, "%s", name);
    else if (chart->numRowsOfSeveral == 1)
        snprintf(text, rowTitleCapacity, chart->numRows == 1 ? "all %d" : "%d others", row->count);
    else
        snprintf(text, rowTitleCapacity, "%s +%d", name, row->count - 1);
}

void makeReadable(const char* timestamp, char* text)
{
    if (strlen(timestamp) != timestampLength)
        snprintf(text, readableCapacity, "%s", timestamp);
    else
        snprintf(text, readableCapacity, "%.4s-%.2s-%.2s %.2s:%.2s:%.2s", timestamp, timestamp + 4,
                 timestamp + 6, timestamp + 8, timestamp + 10, timestamp + 12);
}

int makeLabel(const char* timestamp, const char* before, char* label)
{
    char readable[readableCapacity];
    makeReadable(timestamp, readable);
    if (strncmp(timestamp, before, 4) != 0)
        return snprintf(label, readableCapacity, "%.10s", readable);
    if (strncmp(timestamp, before, 8) != 0)
        return snprintf(label, readableCapacity, "%.5s", readable + 5);
    return snprintf(label, readableCapacity, "%.5s", readable + 11);
}

// --- Building ------------------------------------------------------------------------------------

// Allocates zeros, for one thing at least.
static void* allocate(size_t count, size_t size)
{
    return calloc(count + 1, size);
}

static bool allocateBuilder(chartBuilder* builder)
{
    imageChart* chart = builder->chart;
    size_t tablespaces = static_cast<size_t>(chart->walk.numTablespaces);
    size_t links = static_cast<size_t>(chart->walk.numLinks);
    size_t entries = static_cast<size_t>(chart->walk.history->numEntries);
    builder->missing = static_cast<missingImage*>(allocate(tablespaces, sizeof(missingImage)));
    builder->columnOf = static_cast<int*>(allocate(entries, sizeof(int)));
    builder->awaited = static_cast<bool*>(allocate(entries, sizeof(bool)));
    builder->needed = static_cast<bool*>(allocate(links, sizeof(bool)));
    builder->lineage = static_cast<bool*>(allocate(links, sizeof(bool)));
    chart->columns =
        static_cast<chartColumn*>(allocate(entries + tablespaces, sizeof(chartColumn)));
    chart->rows = static_cast<chartRow*>(allocate(tablespaces, sizeof(chartRow)));
    chart->rowOf = static_cast<int*>(allocate(tablespaces, sizeof(int)));
    for (size_t i = 0; builder->missing != nullptr && i < tablespaces; i++)
        builder->missing[i].before = -1;
    return builder->missing != nullptr && builder->columnOf != nullptr &&
           builder->awaited != nullptr && builder->needed != nullptr &&
           builder->lineage != nullptr && chart->columns != nullptr && chart->rows != nullptr &&
           chart->rowOf != nullptr;
}

static bool fillChart(chartBuilder* builder, int last)
{
    imageChart* chart = builder->chart;
    if (!allocateBuilder(builder))
        return false;
    markNeededChains(builder);
    listColumns(builder, last);
    size_t size =
        static_cast<size_t>(chart->walk.numTablespaces) * static_cast<size_t>(chart->numColumns);
    chart->cells = static_cast<char*>(malloc(size + 1));
    if (chart->cells == nullptr)
        return false;
    memset(chart->cells, chartNothing, size);
    markLineage(&chart->walk, builder->lineage);
    fillCells(builder);
    groupRows(chart, nullptr, chart->numColumns);
    return true;
}

int makeChart(const imageCatalog* catalog, int target, imageChart* chart)
{
    chartBuilder builder = {};
    builder.chart = chart;
    chart->target = target;
    int last = target >= 0 ? target : catalog->history.numEntries - 1;
    int rc = walkChains(catalog, last, &chart->walk);
    if (rc == 0 && !fillChart(&builder, last))
        rc = failWithCode(sqloSystemError | ENOMEM, "draw", "chart");
    free(builder.missing);
    free(builder.columnOf);
    free(builder.awaited);
    free(builder.needed);
    free(builder.lineage);
    return rc;
}

void freeChart(imageChart* chart)
{
    free(chart->columns);
    free(chart->cells);
    free(chart->rows);
    free(chart->rowOf);
    freeChains(&chart->walk);
}
