// A chart of a history: tablespaces down, images across in time. The text and the SVG draw it.
#pragma once

#include "admin/chains.h"

// What a cell shows. A letter in upper case is needed for the target.
enum : char {
    chartNothing = '.', // the image does not hold the tablespace
    chartFull = 'F',
    chartIncremental = 'I',
    chartDelta = 'D',
    chartDiscarded = 'x', // a restore went back to before it, or the tablespace was made anew
    chartMissing = '?',
};

struct chartColumn {
    const historyEntry* image; // null: an image that is missing
    const char* missing;       // its timestamp; null: unknown
    bool needed;
};

// Tablespaces whose cells are all equal.
struct chartRow {
    int first; // the first one's number
    int count;
    const char* cells; // one for each column
};

struct imageChart {
    chainWalk walk;
    int target; // position; -1: the newest state of every tablespace
    chartColumn* columns;
    int numColumns;
    char* cells; // of all tablespaces, by number
    chartRow* rows;
    int numRows;
    int numRowsOfSeveral;
    int* rowOf; // by the tablespace's number; -1: none
};

// Makes the chart of the history up to the image at the target position; -1: to its end. Returns 0,
// or exitFailed after a complaint. freeChart accepts a zero-filled record.
int makeChart(const imageCatalog* catalog, int target, imageChart* chart);
void freeChart(imageChart* chart);

// A cell's letter in upper case, and the words for it.
char kindOfCell(char cell);
const char* wordsForCell(char cell);

// The timestamp of a column's image; null: unknown.
const char* timestampOfColumn(const chartColumn* column);

// Makes the rows anew out of what some columns show, negative ones aside; null: all columns.
void groupRows(imageChart* chart, const int* columns, int numColumns);

// What a row is called. text: room for rowTitleCapacity bytes, which are not escaped.
enum : unsigned int { rowTitleCapacity = 48 };
void titleOfRow(const imageChart* chart, const chartRow* row, char* text);

// Writes a timestamp as people do, 2025-01-11 01:00:00; as it is when it has no 14 characters.
enum : unsigned int { readableCapacity = 24 };
void makeReadable(const char* timestamp, char* text);

// Writes what a column is called after a label for an earlier timestamp, as much of its time as is
// new, and returns its length. label: room for readableCapacity bytes.
int makeLabel(const char* timestamp, const char* before, char* label);

// Draws the chart on standard output, so many characters wide (charttext.cpp). False: no memory.
bool drawText(imageChart* chart, int width, bool colored);

// Draws the chart as one SVG document (chartsvg.cpp).
void drawSvg(const imageChart* chart, FILE* out);
