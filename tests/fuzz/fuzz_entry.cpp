// The entry reader: no byte outside the record is touched, the fixed part is taken as the scanning
// format takes it, and a row of the record holds what the reader reads.

#include <cstdlib>

#include "history/sqluhRows.h"
#include "memoryfile.h"
#include "tests/history/scanaside.h"

// Puts the right checksum over the first characters of the record that begins the file.
static void stamp(char* file, size_t size)
{
    char digits[9] = {};
    memcpy(digits, file + entryFields[fieldSize].at, 8);
    const unsigned long length = strtoul(digits, nullptr, 16);
    memcpy(file, "00000000", 8);
    if (length > size)
        return;
    sqluhSprintf(digits, checksumFormat, sqluhChecksum(file, static_cast<unsigned int>(length)));
    memcpy(file, digits, 8);
}

// A caller's place for an entry. Which buffers it has, and how large, the mode tells.
struct place {
    char texts[12][64];
    textBuffer names[2];
    sqlca ca;
    zq3HistoryData record;
    SQLUH_ENTRY entry;
};

static void prepare(place* p, uint8_t mode)
{
    memset(p, 0, sizeof *p);
    p->names[0] = {p->texts[0], 8, 0};
    p->names[1] = {p->texts[1], 64, 0};
    p->entry.data = &p->record;
    textBuffer* wanted = &p->record.objectPart;
    for (unsigned int i = 0; i < 10; i++)
        if ((mode & 2) == 0 || i == 0 || i == 4)
            wanted[i] = {p->texts[i + 2], (mode & 4) != 0 && i >= 5 ? 7u : 64u, 0};
    p->record.tablespaceBuffers = (mode & 8) != 0 ? nullptr : p->names;
    p->record.maxTablespaces = 2;
    p->record.eventSqlca = (mode & 16) != 0 ? nullptr : &p->ca;
}

static bool isTaken(int rc)
{
    return rc == 0 || rc == TABLESPACE_LIST_TRUNCATED;
}

// The record once more, as a row: beside one of its own kind, which it may share its names with.
static void compareRow(const place* read, int rc, SQLUH_WORKAREA* workArea, uint8_t mode)
{
    static place row;
    static sqluhProvenEntry proven;
    sqluhRows rows = {};
    sqluhBeginProving(&proven, true);
    for (int i = 0; i < 2; i++) {
        prepare(&row, mode);
        filePosition = 0;
        int added = sqluhProveEntry(memoryHandle, &row.entry, workArea, &proven, nullptr);
        if (added == 0)
            added = sqluhAddRow(&rows, &row.entry, workArea, &proven);
        REQUIRE(added == (isTaken(rc) ? 0 : rc));
    }
    prepare(&row, mode);
    if (isTaken(rc)) {
        REQUIRE(sqluhTakeRow(rows.rows[1], &row.entry, false) == rc);
        REQUIRE(sameNumbers(row.entry, read->entry));
        REQUIRE(memcmp(row.texts, read->texts, sizeof row.texts) == 0);
        REQUIRE(memcmp(&row.ca, &read->ca, sizeof row.ca) == 0);
    }
    sqluhFreeRows(&rows);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static char file[4096];
    static place read;
    static SQLUH_WORKAREA workArea;
    if (size == 0 || size > sizeof file)
        return 0;
    // A work area of the record's own size: the sanitizer then guards the bytes after the record.
    if (workArea.buffer == nullptr)
        REQUIRE(sqluhInitWorkArea(&workArea, entryFixedLength) == 0);
    // The first byte: whether the checksum is made to match, and what the caller has room for.
    const uint8_t mode = data[0];
    size--;
    memcpy(file, data + 1, size);
    if ((mode & 1) != 0 && size >= entryFixedLength)
        stamp(file, size);

    prepare(&read, mode);
    serveFile(reinterpret_cast<uint8_t*>(file), size);
    unsigned int flags = 0;
    int rc =
        sqluhReadEntry(memoryHandle, &read.entry, &workArea, "20260101", "Q", "N", "T", &flags);
    REQUIRE(workArea.size <= std::max<size_t>(size, entryFixedLength));
    scannedPart scanned;
    scanAside(file, &scanned);
    if (size >= entryFixedLength)
        REQUIRE(agrees(&scanned, rc, read.entry));
    if (isTaken(rc)) {
        REQUIRE(filePosition == read.entry.size && (flags & 0x38) != 0);
        const textBuffer* texts = &read.record.objectPart;
        for (unsigned int i = 0; i < 10; i++)
            REQUIRE(texts[i].data == nullptr || strlen(texts[i].data) < texts[i].capacity);
    }
    compareRow(&read, rc, &workArea, mode);
    // Back to the smallest area, so that each run meets the growing.
    if (workArea.size > entryFixedLength) {
        sqlofmblkEx(workArea.buffer);
        workArea = {};
    }
    return 0;
}
