// The chart on a terminal.
#include <cstdlib>
#include <cstring>

#include "admin/chart.h"

enum : int { widestPitch = 3 };

// What of a chart is shown: columns of the chart, or noColumn for those left out between two.
enum : int { noColumn = -1 };
static constexpr char leftOut = ':';
struct chartView {
    const imageChart* chart;
    int* columns;
    int numColumns, numLeftOut;
    int titleWidth, pitch;
    bool colored;
};

// --- What fits -----------------------------------------------------------------------------------

// Counts the columns that are kept and the places between them where others are left out.
static int countWidth(const bool* kept, int numColumns)
{
    int width = 0;
    for (int i = 0; i < numColumns; i++)
        width += kept[i] || i == 0 || kept[i - 1];
    return width;
}

// Keeps the needed columns, as far as there is room from the newest on, then the newest others.
static void keepColumns(const imageChart* chart, int room, bool* kept)
{
    int width = 0;
    for (int neededOnly = 1; neededOnly >= 0; neededOnly--)
        for (int i = chart->numColumns - 1; i >= 0 && width < room; i--) {
            if (kept[i] || (neededOnly && !chart->columns[i].needed))
                continue;
            kept[i] = true;
            width = countWidth(kept, chart->numColumns);
            if (width > room)
                kept[i] = false;
        }
}

static bool chooseColumns(chartView* view, int room)
{
    const imageChart* chart = view->chart;
    size_t count = static_cast<size_t>(chart->numColumns) + 1;
    bool* kept = static_cast<bool*>(calloc(count, sizeof(bool)));
    view->columns = static_cast<int*>(calloc(count, sizeof(int)));
    bool allocated = kept != nullptr && view->columns != nullptr;
    if (allocated && chart->numColumns <= room)
        memset(kept, true, count);
    else if (allocated)
        keepColumns(chart, room, kept);
    for (int i = 0; allocated && i < chart->numColumns; i++) {
        view->numLeftOut += !kept[i];
        if (kept[i])
            view->columns[view->numColumns++] = i;
        else if (i == 0 || kept[i - 1])
            view->columns[view->numColumns++] = noColumn;
    }
    free(kept);
    return allocated;
}

// How long a title is with its escapes (putEscaped).
static int lengthOfTitle(const char* title)
{
    int length = 0;
    for (; *title != '\0'; title++)
        length += *title == '\n' || *title == '\\' ? 2 : *title < ' ' || *title > '~' ? 4 : 1;
    return length;
}

static void measureTitles(chartView* view)
{
    view->titleWidth = 0;
    char title[rowTitleCapacity];
    for (int i = 0; i < view->chart->numRows; i++) {
        titleOfRow(view->chart, &view->chart->rows[i], title);
        int length = lengthOfTitle(title);
        view->titleWidth = length > view->titleWidth ? length : view->titleWidth;
    }
}

// --- The head ------------------------------------------------------------------------------------

static int lastMark(const char* marks, int end)
{
    while (marks[end] != '|')
        end--;
    return end;
}

// Two lines: labels where there is room, and marks at their columns.
static void drawLabels(const chartView* view, int width)
{
    char labels[1024], marks[sizeof labels];
    const char* before = "";
    int at = view->titleWidth + 2, end = 0;
    memset(labels, ' ', sizeof labels);
    memset(marks, ' ', sizeof marks);
    for (int i = 0; i < view->numColumns; i++, at += view->pitch) {
        const chartColumn* column =
            view->columns[i] == noColumn ? nullptr : &view->chart->columns[view->columns[i]];
        const char* timestamp = column != nullptr ? timestampOfColumn(column) : nullptr;
        char label[readableCapacity];
        if (timestamp == nullptr || strlen(timestamp) != timestampLength || at < end)
            continue;
        int length = makeLabel(timestamp, before, label);
        if (at + length > width || at + length > static_cast<int>(sizeof labels))
            continue;
        memcpy(labels + at, label, static_cast<size_t>(length));
        marks[at] = '|';
        end = at + length + 1;
        before = timestamp;
    }
    if (end != 0)
        printf("%.*s\n%.*s|\n", end - 1, labels, lastMark(marks, end), marks);
}

// --- Cells ---------------------------------------------------------------------------------------

static const char* colorOf(char cell)
{
    switch (cell) {
    case chartFull:
        return "\033[1;34m";
    case chartIncremental:
        return "\033[1;33m";
    case chartDelta:
        return "\033[1;36m";
    case chartMissing:
        return "\033[1;31m";
    default:
        return "\033[2m";
    }
}

static char cellInView(const chartView* view, const chartRow* row, int i)
{
    return view->columns[i] == noColumn ? leftOut : row->cells[view->columns[i]];
}

static void putRow(const chartView* view, const chartRow* row)
{
    char title[rowTitleCapacity];
    titleOfRow(view->chart, row, title);
    putEscaped(stdout, title, strlen(title));
    printf("%*s", view->titleWidth - lengthOfTitle(title) + 2, "");
    for (int i = 0; i < view->numColumns; i++) {
        char cell = cellInView(view, row, i);
        printf("%*s", i == 0 ? 0 : view->pitch - 1, "");
        if (view->colored)
            printf("%s%c\033[0m", colorOf(cell), cell);
        else
            putchar(cell);
    }
    putchar('\n');
}

// Explains the cells that are there.
static void drawLegend(const chartView* view)
{
    static constexpr struct {
        const char *cells, *words;
    } legend[] = {
        {"FID", "F I D  needed: full, incremental, delta"},
        {"fid", "f i d  not needed"},
        {"x", "x      discarded by a restore"},
        {"?", "?      missing"},
        {".", ".      not in the image"},
    };
    bool seen[256] = {};
    for (int row = 0; row < view->chart->numRows; row++)
        for (int i = 0; i < view->numColumns; i++)
            seen[static_cast<unsigned char>(cellInView(view, &view->chart->rows[row], i))] = true;
    putchar('\n');
    for (const auto& line : legend) {
        bool any = false;
        for (const char* cell = line.cells; *cell != '\0'; cell++)
            any = any || seen[static_cast<unsigned char>(*cell)];
        if (any)
            puts(line.words);
    }
    if (view->numLeftOut != 0)
        printf(":      %d images left out\n", view->numLeftOut);
}

bool drawText(imageChart* chart, int width, bool colored)
{
    chartView view = {};
    view.chart = chart;
    view.colored = colored;
    measureTitles(&view);
    int room = width - view.titleWidth - 2;
    room = room < 1 ? 1 : room;
    bool allocated = chooseColumns(&view, room);
    view.pitch = view.numColumns < 2 ? int{widestPitch} : (room - 1) / (view.numColumns - 1);
    view.pitch = view.pitch > widestPitch ? int{widestPitch} : view.pitch;
    if (allocated) {
        groupRows(chart, view.columns, view.numColumns);
        measureTitles(&view);
        drawLabels(&view, width);
        for (int row = 0; row < chart->numRows; row++)
            putRow(&view, &chart->rows[row]);
        drawLegend(&view);
    }
    free(view.columns);
    return allocated;
}
