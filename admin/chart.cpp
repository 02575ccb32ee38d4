// zq3hist chart: which images hold which tablespaces, and which of them are needed.
#include "admin/chart.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <sys/ioctl.h>
#include <unistd.h>

static void putJsonColumn(jsonWriter* json, const chartColumn* column)
{
    beginJson(json, nullptr, '{');
    putJsonBool(json, "known", column->image != nullptr);
    if (column->image != nullptr)
        putJsonImage(json, column->image);
    else
        putJsonText(json, "timestamp", column->missing);
    putJsonBool(json, "needed", column->needed);
    endJson(json, '}');
}

static void drawJson(const imageChart* chart)
{
    jsonWriter json;
    beginAnswer(&json);
    putJsonText(&json, "target",
                chart->target < 0 ? nullptr
                                  : chart->walk.history->entries[chart->target].timestamp);
    beginJson(&json, "images", '[');
    for (int i = 0; i < chart->numColumns; i++)
        putJsonColumn(&json, &chart->columns[i]);
    endJson(&json, ']');
    beginJson(&json, "rows", '[');
    for (int row = 0; row < chart->numRows; row++) {
        beginJson(&json, nullptr, '{');
        beginJson(&json, "tablespaces", '[');
        for (int i = 0; i < chart->walk.numTablespaces; i++)
            if (chart->rowOf[i] == row)
                putJsonText(&json, nullptr, chart->walk.tablespaces[i].name);
        endJson(&json, ']');
        putJsonBytes(&json, "cells", chart->rows[row].cells,
                     static_cast<size_t>(chart->numColumns));
        endJson(&json, '}');
    }
    endJson(&json, ']');
    endJsonLine(&json);
}

static int writeSvg(const imageChart* chart, const char* path)
{
    bool isOutput = strcmp(path, "-") == 0;
    FILE* out = isOutput ? stdout : fopen(path, "we");
    if (out == nullptr)
        return failWithCode(sqloSystemError | errno, "write the chart", path);
    drawSvg(chart, out);
    if (isOutput)
        return 0; // main looks after it
    bool written = ferror(out) == 0;
    written = fclose(out) == 0 && written;
    return written ? 0 : failWithCode(sqloSystemError | errno, "write the chart", path);
}

// The width of the terminal; else what COLUMNS says, or 80.
static int terminalWidth(void)
{
    winsize size = {};
    const char* columns = getenv("COLUMNS");
    int width = ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 ? size.ws_col : 0;
    if (width == 0 && columns != nullptr)
        width = atoi(columns);
    return width > 0 ? width : 80;
}

// Sets whether to color. Complains and returns exitUsage when it is told in a wrong word.
static int takeColor(const char* when, bool* colored)
{
    const char* never = getenv("NO_COLOR");
    if (when != nullptr && strcmp(when, "always") != 0 && strcmp(when, "never") != 0 &&
        strcmp(when, "auto") != 0)
        return failUsage("--color takes always, never or auto, not %s", when);
    if (when == nullptr || strcmp(when, "auto") == 0)
        *colored = isatty(STDOUT_FILENO) && (never == nullptr || never[0] == '\0');
    else
        *colored = strcmp(when, "always") == 0;
    return 0;
}

static int drawChart(imageChart* chart, const commandLine* line, bool colored)
{
    char readable[readableCapacity];
    if (line->svg != nullptr)
        return writeSvg(chart, line->svg);
    if (line->json) {
        drawJson(chart);
        return 0;
    }
    if (chart->numColumns == 0) {
        puts("No image is there.");
        return 0;
    }
    if (chart->target >= 0)
        makeReadable(chart->walk.history->entries[chart->target].timestamp, readable);
    printf("What %s needs\n\n", chart->target < 0 ? "the newest state" : readable);
    return drawText(chart, terminalWidth(), colored)
               ? 0
               : failWithCode(sqloSystemError | ENOMEM, "draw", "chart");
}

int chartMain(commandLine* line)
{
    imageCatalog catalog = {};
    imageChart chart = {};
    char timestamp[timestampLength + 1] = "latest";
    bool colored = false;
    bool isLatest = line->numArguments > 0 && strcmp(line->arguments[0], timestamp) == 0;
    int target = -1;
    int rc = line->json && line->svg != nullptr ? failUsage("chart takes --svg or --json, not both")
                                                : takeColor(line->color, &colored);
    if (rc == 0 && line->svg != nullptr && isHistoryFile(&line->place, line->svg))
        rc = fail(line->svg, "the picture would replace the history itself");
    if (rc == 0 && line->numArguments > 0 && !isLatest)
        rc = takeInstant("chart", line->arguments[0], timestamp);
    if (rc == 0)
        rc = readCatalog(&line->place, nullptr, &catalog);
    if (rc == 0 && isLatest)
        target = newestImage(&catalog);
    else if (rc == 0 && line->numArguments > 0)
        target = findImage(&catalog, timestamp);
    if (rc == 0 && line->numArguments > 0 && target < 0)
        rc = failNoImage(&line->place, &catalog, timestamp);
    if (rc == 0)
        rc = makeChart(&catalog, target, &chart);
    if (rc == 0)
        rc = drawChart(&chart, line, colored);
    freeChart(&chart);
    freeCatalog(&catalog);
    return rc;
}
