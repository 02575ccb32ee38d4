// An entry in the work area, read and proven, from which its parts can be taken out. Shared by the
// sources that read entries.
//
// operation, in all of these, is the name under which failures are logged; null: they are not.
#pragma once

#include <cstdio>
#include <cstring>

#include "history/sqluhColumns.h"
#include "history/sqluhFixedPart.h"

enum : unsigned int { optionalLetterCount = 3 };

// Offsets are from the start of the record, which is in the work area.
struct sqluhProvenEntry {
    bool begun;                         // the file held something at its position
    char optional[optionalLetterCount]; // object, operation type and aux code, "-" as it stands
    sqluhFixedPart fixed;
    uint32_t objectNamesAt; // both lines, if the entry has any
    uint32_t tablespacesAt;
    uint32_t tablespacesEnd; // at most: what comes after them still fits
    uint32_t tailAt;         // the sqlca line; set by sqluhPassTablespaces
    // The tablespace lines of a neighbour, proven, if they are not too many.
    uint32_t keptCount;
    uint32_t keptLength;
    char keptLines[16 * 1024];
};

// Prepares a record for one entry or, forNeighbours, for entries read one after the other.
static inline void sqluhBeginProving(sqluhProvenEntry* proven, bool forNeighbours)
{
    proven->fixed.isKept = false;
    proven->fixed.forNeighbours = forNeighbours;
    proven->keptCount = proven->keptLength = 0;
}

// Reads the entry at the file's position and proves its checksum, and that its sections lie inside
// it: the tablespace lines only by their number. *entry, and the numbers and letters of its data,
// are filled. Returns 0, END_OF_FILE, HISTORY_FILE_DAMAGED, a transfer code, a seek's or the
// allocation's code, as sqluhReadEntry does.
int sqluhProveEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                    sqluhProvenEntry* proven, const char* operation);

// Proves the tablespace lines of a proven entry. Returns 0 or HISTORY_FILE_DAMAGED.
int sqluhPassTablespaces(const SQLUH_ENTRY* entry, const SQLUH_WORKAREA* workArea,
                         sqluhProvenEntry* proven, const char* operation);

// Reads and proves the whole entry at the file's position, and takes nothing out. Returns what
// sqluhReadEntry without filters does, but for TABLESPACE_LIST_TRUNCATED, and logs the same.
int sqluhCheckEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                    sqluhProvenEntry* proven);

// --- Taking texts out ----------------------------------------------------------------------------

static inline void copyText(textBuffer* target, const char* text, size_t length)
{
    target->length = static_cast<uint32_t>(length);
    if (target->data == nullptr || target->capacity == 0)
        return;
    size_t copied = length < target->capacity ? length : target->capacity - 1;
    copyShort(target->data, text, copied);
    target->data[copied] = '\0';
}

// The length of the text that a field's word stands for: 0 for what stands in the file for none,
// and for the log position, which is no text.
static inline size_t lengthOfWord(const char* word, sqluhFieldKind kind)
{
    if (kind == kindLogPosition)
        return 0;
    return strcmp(word, kind == kindTimestamp ? SQLUH_EMPTY_TIMESTAMP : SQLUH_EMPTY_WORD) == 0
               ? 0
               : strlen(word);
}

// For a head that is no number: does not fit, whatever room there is.
static constexpr uint64_t noTablespaceLength = UINT64_MAX - tablespaceLineExtra;

// The length at the head of a tablespace line: what scanning a hexadecimal number of eight
// characters gives.
static inline uint64_t tablespaceLength(const char* line)
{
    // The next line's place waits for this number, so the usual one, of two digits, takes the
    // shortest way to it.
    uint32_t high = hexDigits.value[static_cast<unsigned char>(line[6])];
    uint32_t low = hexDigits.value[static_cast<unsigned char>(line[7])];
    if (memcmp(line, "000000", 6) == 0 && (high | low) <= 0x0F)
        return high << 4 | low;
    uint32_t length = 0;
    if (hexColumns(line, &length))
        return length;
    char digits[headerNumberWidth + 1];
    memcpy(digits, line, headerNumberWidth);
    digits[headerNumberWidth] = '\0';
    return sscanf(digits, "%8x", &length) == 1 ? length : noTablespaceLength;
}

// Tells whether the tablespace line at at has a length and fits before end. Starts with *head 0,
// which is no number.
//
// Neighbouring names often have one length. Comparing the head with the last one lets the processor
// go on with the next line before this one's number is known.
static inline bool tablespaceFits(const char* at, const char* end, uint64_t* head, uint64_t* length)
{
    if (end - at < static_cast<ptrdiff_t>(tablespaceLineExtra))
        return false;
    uint64_t digits = columnsAt(at);
    if (digits != *head)
        *length = tablespaceLength(at);
    *head = digits;
    return static_cast<uint64_t>(end - at) >= *length + tablespaceLineExtra;
}

// Takes the six bytes out of a text of 12 hexadecimal digits; zero from the first group of four on
// that is none.
void sqluhParseLogPosition(const char* text, uint8_t* position);

// Takes an sqlca line, of 194 characters, apart.
void sqluhFillSqlca(sqlca* ca, const char* line);
