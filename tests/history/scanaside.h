// The fixed part of an entry as the scanning format takes it, apart from the reader's own scan.
#pragma once

#include <algorithm>
#include <cstdio>
#include <cstring>

#include "history/sqluhist.h"

struct scannedPart {
    int found = 0;
    zq3HistoryData data = {};
    SQLUH_ENTRY entry = {};
    char words[6][25] = {}; // the log position is the last
};

inline void scanAside(const char* text, scannedPart* s)
{
    char line[513] = {};
    memcpy(line, text, 512);
    SQLUH_ENTRY& e = s->entry;
    zq3HistoryData& d = s->data;
    e.data = &d;
    s->found = sscanf(line,
                      "%8x:%4hx:%8x:%8x:%8u:%c:%8x:%8x:%8x:%8x:%8x:%8x:%8x:\n"
                      "%c:%c:%c:%17s :%14s :%12s :%12s :%12s :%24s :%c:\n",
                      &e.checksum, &d.entryNode, &d.entryNumber, &e.size, &e.version, &d.status,
                      &e.noteLength, &e.longTextLength, &e.qualifierLength, &e.nameLength,
                      &d.numTablespaces, &e.sqlcaLength, &e.commandLength, &d.operation, &d.object,
                      &d.operationType, s->words[0], s->words[1], s->words[2], s->words[3],
                      s->words[5], s->words[4], &d.auxCode);
}

// Compares the numbers and letters of two fixed parts.
inline bool sameNumbers(const SQLUH_ENTRY& a, const SQLUH_ENTRY& b)
{
    return memcmp(&a, &b, 9 * sizeof(uint32_t)) == 0 &&
           memcmp(&a.data->operation, &b.data->operation, 5) == 0 &&
           a.data->numTablespaces == b.data->numTablespaces &&
           a.data->entryNode == b.data->entryNode && a.data->entryNumber == b.data->entryNumber;
}

// Tells whether the reader, which returned rc, took into an empty entry what the scan took.
inline bool agrees(scannedPart* s, int rc, const SQLUH_ENTRY& entry)
{
    const bool read = rc == 0 || rc == TABLESPACE_LIST_TRUNCATED, all = s->found == 23;
    for (char* letter : {&s->data.object, &s->data.operationType, &s->data.auxCode})
        *letter = all && *letter == '-' ? ' ' : *letter;
    if (read || entry.noteLength == 30)
        s->entry.noteLength = std::min(s->entry.noteLength, 30u);
    if (read || entry.longTextLength == 255)
        s->entry.longTextLength = std::min(s->entry.longTextLength, 255u);
    bool same = (all || rc == HISTORY_FILE_DAMAGED) && sameNumbers(s->entry, entry);
    if (!read)
        return same;

    for (int i = 0; i < 5; i++) {
        const textBuffer& got = (&entry.data->objectPart)[i];
        const char* word =
            strcmp(s->words[i], i < 2 ? "00000101000000" : "-") == 0 ? "" : s->words[i];
        same &= got.data == nullptr || strcmp(got.data, word) == 0;
    }
    uint8_t position[6] = {};
    for (int i = 0; i < 3 && strspn(s->words[5] + 4 * i, "0123456789abcdefABCDEF") >= 4; i++)
        sscanf(s->words[5] + 4 * i, "%2hhx%2hhx", &position[2 * i], &position[2 * i + 1]);
    return same && memcmp(position, entry.data->logPosition, 6) == 0;
}
