// The entry reader: no byte outside the record is touched, and the fixed part is taken as the
// scanning format takes it.

#include <cstdlib>

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

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static char file[4096], texts[12][64];
    static SQLUH_WORKAREA workArea;
    if (size == 0 || size > sizeof file)
        return 0;
    // A work area of the record's own size: the sanitizer then guards the bytes behind the record.
    if (workArea.buffer == nullptr)
        REQUIRE(sqluhInitWorkArea(&workArea, entryFixedLength) == 0);
    // The first byte: whether the checksum is made to match, and what the caller has room for.
    const uint8_t mode = data[0];
    size--;
    memcpy(file, data + 1, size);
    if ((mode & 1) != 0 && size >= entryFixedLength)
        stamp(file, size);

    sqlca ca;
    textBuffer names[2] = {{texts[0], 8, 0}, {texts[1], 64, 0}};
    zq3HistoryData record = {};
    SQLUH_ENTRY entry = {};
    entry.data = &record;
    textBuffer* wanted = &record.objectPart;
    for (unsigned int i = 0; i < 10; i++)
        if ((mode & 2) == 0 || i == 0 || i == 4)
            wanted[i] = {texts[i + 2], (mode & 4) != 0 && i >= 5 ? 7u : 64u, 0};
    record.tablespaceBuffers = (mode & 8) != 0 ? nullptr : names;
    record.maxTablespaces = 2;
    record.eventSqlca = (mode & 16) != 0 ? nullptr : &ca;

    serveFile(reinterpret_cast<uint8_t*>(file), size);
    unsigned int flags = 0;
    int rc = sqluhReadEntry(memoryHandle, &entry, &workArea, "20260101", "Q", "N", "T", &flags);
    REQUIRE(workArea.size <= std::max<size_t>(size, entryFixedLength));
    scannedPart scanned;
    scanAside(file, &scanned);
    if (size >= entryFixedLength)
        REQUIRE(agrees(&scanned, rc, entry));
    if (rc == 0 || rc == TABLESPACE_LIST_TRUNCATED) {
        REQUIRE(filePosition == entry.size && (flags & 0x38) != 0);
        for (unsigned int i = 0; i < 10; i++)
            REQUIRE(wanted[i].data == nullptr || strlen(wanted[i].data) < wanted[i].capacity);
    }
    // Back to the smallest area, so that each run meets the growing.
    if (workArea.size > entryFixedLength) {
        sqlofmblkEx(workArea.buffer);
        workArea = {};
    }
    return 0;
}
