// The chart as a picture: one SVG document without scripts.
//
// It is as wide as a phone shows legibly and goes on downwards in bands, so that any number of
// images fits; larger screens and paper enlarge it. A column's tooltip is its title element. Kinds
// differ in height and letter as well as in color, and the colors in lightness as well as in hue.
#include <cstring>

#include "admin/chart.h"

// Lengths are in units of the picture.
enum : int {
    pictureWidth = 400,
    margin = 10,
    rowHeight = 17,
    cellHeight = 14,
    labelHeight = 16,
    bandGap = 14,
    headHeight = 52,
    legendHeight = 62,
    widestCell = 44,
    letterCell = 10, // narrower cells have no letters
    narrowestCell = 4,
    mostLettered = 400, // columns
    letterWidth = 6,    // of a row's title
    smallLetterWidth = 5,
};

struct svgLayout {
    const imageChart* chart;
    FILE* out;
    int titleWidth;
    int pitch;
    int perBand; // columns
    int bandHeight;
};

// Writes a text; what is not printable stands there as an escape.
static void putXml(FILE* out, const char* text)
{
    for (; *text != '\0'; text++)
        if (strchr("<>&\"", *text) != nullptr)
            fprintf(out, "&#%d;", *text);
        else
            putEscaped(out, text, 1);
}

static bool hasLetters(const svgLayout* layout)
{
    return layout->pitch >= letterCell;
}

// --- Cells ---------------------------------------------------------------------------------------

static int heightOfCell(const svgLayout* layout, char cell)
{
    char kind = kindOfCell(cell);
    if (hasLetters(layout) || (kind != chartIncremental && kind != chartDelta))
        return cellHeight;
    return kind == chartIncremental ? cellHeight * 2 / 3 : cellHeight / 3;
}

static const char* classOfCell(char cell)
{
    switch (cell) {
    case chartFull:
        return "F";
    case chartIncremental:
        return "I";
    case chartDelta:
        return "D";
    case chartMissing:
        return "M";
    case chartDiscarded:
        return "X";
    default:
        return kindOfCell(cell) == chartFull          ? "f"
               : kindOfCell(cell) == chartIncremental ? "i"
                                                      : "d";
    }
}

// Draws a cell whose upper left corner is at (x, y).
static void putCell(const svgLayout* layout, int x, int y, int width, char cell)
{
    int height = heightOfCell(layout, cell);
    const char* name = classOfCell(cell);
    fprintf(layout->out, "<rect class=\"%s\" x=\"%d\" y=\"%d\" width=\"%d\" height=\"%d\"/>", name,
            x, y + cellHeight - height, width, height);
    if (hasLetters(layout) || cell == chartMissing)
        fprintf(layout->out, "<text class=\"l%s\" x=\"%.1f\" y=\"%d\">%c</text>", name,
                x + width / 2.0, y + cellHeight - 3, cell);
}

// --- Columns -------------------------------------------------------------------------------------

static void putTooltip(const svgLayout* layout, int column)
{
    const imageChart* chart = layout->chart;
    const chartColumn* shown = &chart->columns[column];
    const char* timestamp = timestampOfColumn(shown);
    char text[readableCapacity] = "A full image";
    char title[rowTitleCapacity];
    fputs("<title>", layout->out);
    if (timestamp != nullptr)
        makeReadable(timestamp, text);
    putXml(layout->out, text);
    if (shown->image == nullptr)
        fputs(": missing", layout->out);
    else
        fprintf(layout->out, ": %s, %s", kindOfImage(shown->image), scopeOfImage(shown->image));
    for (int row = 0; row < chart->numRows; row++) {
        if (chart->rows[row].cells[column] == chartNothing)
            continue;
        titleOfRow(chart, &chart->rows[row], title);
        fputs("\n", layout->out);
        putXml(layout->out, title);
        fprintf(layout->out, ": %s", wordsForCell(chart->rows[row].cells[column]));
    }
    fputs("</title>", layout->out);
}

static void putColumn(const svgLayout* layout, int column, int x, int y)
{
    int width = layout->pitch - (hasLetters(layout) ? 2 : 1);
    fputs("<g>", layout->out);
    putTooltip(layout, column);
    for (int i = 0; i < layout->chart->numRows; i++) {
        char cell = layout->chart->rows[i].cells[column];
        if (cell != chartNothing)
            putCell(layout, x, y + i * rowHeight, width, cell);
    }
    fputs("</g>\n", layout->out);
}

// --- Bands ---------------------------------------------------------------------------------------

static void putSvgText(const svgLayout* layout, const char* name, int x, int y, const char* text)
{
    fprintf(layout->out, "<text class=\"%s\" x=\"%d\" y=\"%d\">", name, x, y);
    putXml(layout->out, text);
    fputs("</text>\n", layout->out);
}

static void putSvgLabels(const svgLayout* layout, int first, int last, int y)
{
    const char* before = "";
    int end = 0;
    for (int column = first; column < last; column++) {
        const char* timestamp = timestampOfColumn(&layout->chart->columns[column]);
        int x = margin + layout->titleWidth + (column - first) * layout->pitch;
        char label[readableCapacity];
        if (timestamp == nullptr || x < end)
            continue;
        int length = makeLabel(timestamp, before, label);
        if (x + length * smallLetterWidth > pictureWidth)
            break;
        fprintf(layout->out, "<path d=\"M%d.5 %dv4\"/>", x, y - 3);
        putSvgText(layout, "t", x, y - 5, label);
        end = x + (length + 1) * smallLetterWidth;
        before = timestamp;
    }
}

static void putBand(const svgLayout* layout, int first, int last, int y)
{
    char title[rowTitleCapacity];
    putSvgLabels(layout, first, last, y + labelHeight);
    y += labelHeight + 2;
    for (int row = 0; row < layout->chart->numRows; row++) {
        titleOfRow(layout->chart, &layout->chart->rows[row], title);
        putSvgText(layout, "n", margin, y + row * rowHeight + cellHeight - 3, title);
    }
    for (int column = first; column < last; column++)
        putColumn(layout, column, margin + layout->titleWidth + (column - first) * layout->pitch,
                  y);
}

// --- The picture ---------------------------------------------------------------------------------

static void putSvgHead(const svgLayout* layout, int height)
{
    static const char style[] =
        "text{font-family:sans-serif;fill:#222}.h{font-size:15px;font-weight:bold}.s{font-size:"
        "11px}"
        ".n{font-size:10px}.t{font-size:9px;fill:#555}path{stroke:#999;fill:none}"
        ".F{fill:#0072b2}.I{fill:#e69f00}.D{fill:#009e73}.f{fill:#b3d4ea}.i{fill:#f7d99c}"
        ".d{fill:#b0dfcf}.X{fill:#fff;stroke:#aaa}.M{fill:#fff;stroke:#d55e00;stroke-width:2}"
        ".lF,.lI,.lD,.lf,.li,.ld,.lX,.lM{font-size:10px;text-anchor:middle;font-weight:bold}"
        ".lF,.lD{fill:#fff}.lf,.li,.ld{fill:#555;font-weight:normal}.lX{fill:#888}.lM{fill:#"
        "d55e00}";
    const imageChart* chart = layout->chart;
    char readable[readableCapacity] = "the newest state";
    char text[128];
    if (chart->target >= 0)
        makeReadable(chart->walk.history->entries[chart->target].timestamp, readable);
    snprintf(text, sizeof text, "What %s needs", readable);
    fprintf(layout->out,
            "<svg xmlns=\"http://www.w3.org/2000/svg\" viewBox=\"0 0 %d %d\" width=\"100%%\" "
            "style=\"max-width:800px;height:auto\">\n<style>%s</style>\n"
            "<rect width=\"100%%\" height=\"100%%\" fill=\"#fff\"/>\n",
            pictureWidth, height, style);
    putSvgText(layout, "h", margin, 24, text);
    int numImages = 0;
    for (int i = 0; i < chart->numColumns; i++)
        numImages += chart->columns[i].image != nullptr;
    snprintf(text, sizeof text, "%d image%s, the oldest first", numImages,
             numImages == 1 ? "" : "s");
    putSvgText(layout, "s", margin, 41, text);
}

static void putSvgLegend(const svgLayout* layout, int y)
{
    static constexpr struct {
        char cell;
        const char* words;
    } legend[] = {
        {chartFull, "full, needed"},      {chartIncremental, "incremental, needed"},
        {chartDelta, "delta, needed"},    {'f', "full, not needed"},
        {'i', "incremental, not needed"}, {'d', "delta, not needed"},
        {chartMissing, "missing"},        {chartDiscarded, "discarded by a restore"},
    };
    static constexpr int places[] = {margin, 110, 250};
    int number = 0;
    for (const auto& item : legend) {
        int x = places[number % 3], top = y + number / 3 * (rowHeight + 2);
        putCell(layout, x, top, letterCell + 2, item.cell);
        putSvgText(layout, "t", x + letterCell + 6, top + cellHeight - 4, item.words);
        number++;
    }
}

static void layOut(svgLayout* layout)
{
    const imageChart* chart = layout->chart;
    char title[rowTitleCapacity];
    for (int row = 0; row < chart->numRows; row++) {
        titleOfRow(chart, &chart->rows[row], title);
        int width = static_cast<int>(strlen(title)) * letterWidth + 8;
        layout->titleWidth = width > layout->titleWidth ? width : layout->titleWidth;
    }
    int room = pictureWidth - 2 * margin - layout->titleWidth;
    int widest = room / (chart->numColumns > 0 ? chart->numColumns : 1);
    layout->pitch = chart->numColumns > mostLettered ? int{narrowestCell}
                    : widest > widestCell            ? int{widestCell}
                    : widest > letterCell + 2        ? widest
                                                     : letterCell + 2;
    layout->perBand = room / layout->pitch;
    layout->bandHeight = labelHeight + 2 + chart->numRows * rowHeight + bandGap;
}

void drawSvg(const imageChart* chart, FILE* out)
{
    svgLayout layout = {chart, out, 0, 0, 0, 0};
    layOut(&layout);
    int numBands = (chart->numColumns + layout.perBand - 1) / layout.perBand;
    putSvgHead(&layout, headHeight + legendHeight + numBands * layout.bandHeight);
    putSvgLegend(&layout, headHeight);
    for (int band = 0; band < numBands; band++) {
        int first = band * layout.perBand, last = first + layout.perBand;
        putBand(&layout, first, last < chart->numColumns ? last : chart->numColumns,
                headHeight + legendHeight + band * layout.bandHeight);
    }
    fputs("</svg>\n", out);
}
