// Reading entries: read and proven first, then taken out. Stands on the primitives and on the fixed
// part.

#include "history/sqluhred.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "history/sqluhColumns.h"
#include "history/sqluhDiagnostics.h"

static constexpr char readEntry[] = "sqluhReadEntry"; // the operation that the log names

// --- The bytes of an entry -----------------------------------------------------------------------

int sqluhInitWorkArea(SQLUH_WORKAREA* workArea, uint32_t size)
{
    pdtEntry();

    void* block = nullptr;
    int rc = allocateZeroed(size, &block);
    if (rc == 0) {
        workArea->buffer = static_cast<char*>(block);
        workArea->size = size;
    }

    pdtExit(rc);
    return rc;
}

static int readFixedPart(SQLO_FHANDLE fh, SQLUH_WORKAREA* workArea, bool* begun,
                         const char* operation)
{
    uint32_t bytesRead = 0;
    int rc = sqloread(fh, workArea->buffer, entryFixedLength, &bytesRead);
    *begun = bytesRead != 0;
    if (rc == 0 && bytesRead == entryFixedLength)
        return 0;
    if (rc == END_OF_FILE && (bytesRead == 0 || bytesRead == entryFixedLength))
        return rc;
    bool partial = rc == END_OF_FILE || rc == 0;
    logRecord({textItem(partial ? TEXT_ENTRY_PARTIAL : TEXT_ENTRY_READ), codeItem("rc = ", rc),
               numberItem("Bytes read: ", bytesRead),
               dataItem("", workArea->buffer, entryFixedLength)},
              operation);
    return partial ? HISTORY_FILE_DAMAGED : loggedPlain(transferCode(rc), operation);
}

static int parseFixedPart(const char* text, SQLUH_ENTRY* entry, sqluhProvenEntry* proven,
                          const char* operation)
{
    int found = sqluhTakeFixedPart(text, entry, &proven->fixed);
    if (found < static_cast<int>(entryFieldCount)) {
        logRecord({textItem(TEXT_ENTRY_FIELDS), numberItem(TEXT_ENTRY_FIELDS_READ, found),
                   dataItem("", text, entryFixedLength)},
                  operation);
        return HISTORY_FILE_DAMAGED;
    }
    zq3HistoryData* data = entry->data;
    char* letters[optionalLetterCount] = {&data->object, &data->operationType, &data->auxCode};
    for (unsigned int i = 0; i < optionalLetterCount; i++) {
        proven->optional[i] = *letters[i];
        if (*letters[i] == SQLUH_EMPTY_WORD[0])
            *letters[i] = ' ';
    }
    if (entry->size < entryMinLength) {
        logRecord({textItem(TEXT_ENTRY_LENGTHS), numberItem("Size field: ", entry->size),
                   dataItem("", text, entryFixedLength)},
                  operation);
        return HISTORY_FILE_DAMAGED;
    }
    return 0;
}

// Grows the work area for an entry of size bytes, but to no more than the file still holds: a
// damaged size must not ask for memory. *readable receives how much of the body can be asked for.
static int growWorkArea(SQLO_FHANDLE fh, SQLUH_WORKAREA* workArea, uint32_t size,
                        uint32_t* readable, const char* operation)
{
    long long here = 0;
    long long end = 0;
    int rc = sqloseek(fh, 0, sqloFromCurrent, &here);
    if (rc == 0)
        rc = sqloseek(fh, 0, sqloFromEnd, &end);
    if (rc == 0)
        rc = sqloseek(fh, here, sqloFromStart, nullptr);
    if (rc != 0)
        return logged(rc, operation);

    uint64_t left = end > here ? static_cast<uint64_t>(end - here) : 0;
    if (left < size - entryFixedLength)
        *readable = static_cast<uint32_t>(left);
    uint32_t needed = entryFixedLength + *readable;
    if (needed <= workArea->size)
        return 0;
    void* block = workArea->buffer;
    rc = logged(sqloMemBlockReallocate(&block, needed, sqloZeroFilled, __FILE__, __LINE__),
                operation);
    if (rc == 0) {
        workArea->buffer = static_cast<char*>(block);
        workArea->size = needed;
    }
    return rc;
}

static int readBody(SQLO_FHANDLE fh, SQLUH_WORKAREA* workArea, uint32_t size, const char* operation)
{
    uint32_t wanted = size - entryFixedLength;
    uint32_t readable = wanted;
    if (size > workArea->size) {
        int rc = growWorkArea(fh, workArea, size, &readable, operation);
        if (rc != 0)
            return rc;
    }

    char* body = workArea->buffer + entryFixedLength;
    uint32_t bytesRead = 0;
    int rc = sqloread(fh, body, readable, &bytesRead);
    if (rc == 0 && bytesRead == wanted)
        return 0;
    // No more was asked for than the file was known to hold: it ends before the body does.
    if (rc == 0 && readable < wanted)
        rc = END_OF_FILE;
    bool partial = rc == END_OF_FILE || rc == 0;
    if (partial && (bytesRead == 0 || (rc != 0 && bytesRead == wanted)))
        return END_OF_FILE;
    logRecord({textItem(partial ? TEXT_BODY_PARTIAL : TEXT_BODY_READ), codeItem("rc = ", rc),
               numberItem("Bytes read: ", bytesRead), dataItem("", body, bytesRead)},
              operation);
    return partial ? HISTORY_FILE_DAMAGED : loggedPlain(transferCode(rc), operation);
}

static int checkEntryChecksum(SQLUH_WORKAREA* workArea, const SQLUH_ENTRY* entry,
                              const char* operation)
{
    memset(workArea->buffer, 0, entryFields[fieldChecksum].width);
    uint32_t computed = sqluhChecksum(workArea->buffer, entry->size);
    if (computed == entry->checksum)
        return 0;
    logRecord({codeItem(TEXT_ENTRY_CHECKSUM, static_cast<int>(entry->checksum)),
               codeItem(TEXT_ENTRY_OBSERVED, static_cast<int>(computed))},
              operation);
    return HISTORY_FILE_DAMAGED;
}

// --- Proving an entry ----------------------------------------------------------------------------

static int damagedLengths(const SQLUH_ENTRY* entry, const char* operation)
{
    logRecord({textItem(TEXT_ENTRY_LENGTHS), numberItem("Size field: ", entry->size)}, operation);
    return HISTORY_FILE_DAMAGED;
}

// A matching checksum does not make the lengths true: they are held against size here, in 64 bits,
// before anything is read by them.
static int planSections(const SQLUH_ENTRY* entry, sqluhProvenEntry* proven, const char* operation)
{
    uint64_t at = entry->longTextLength != 0 ? entryLongTextAt + lineLength : entryLongTextAt;
    uint64_t objectNames = 0;
    if (entry->qualifierLength != 0 || entry->nameLength != 0)
        objectNames = uint64_t{entry->qualifierLength} + entry->nameLength + 2;
    uint64_t tail = 0;
    if (entry->sqlcaLength != 0)
        tail += sqlcaLineLength;
    if (entry->commandLength != 0)
        tail +=
            uint64_t{entry->commandLength} + (entry->commandLength - 1) / commandPieceLength + 1;
    uint64_t least = uint64_t{entry->data->numTablespaces} * tablespaceLineExtra;
    if (at + objectNames + least + tail > entry->size)
        return damagedLengths(entry, operation);
    proven->objectNamesAt = static_cast<uint32_t>(at);
    proven->tablespacesAt = static_cast<uint32_t>(at + objectNames);
    proven->tablespacesEnd = static_cast<uint32_t>(entry->size - tail);
    return 0;
}

int sqluhProveEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                    sqluhProvenEntry* proven, const char* operation)
{
    int rc = readFixedPart(fh, workArea, &proven->begun, operation);
    if (rc == 0)
        rc = parseFixedPart(workArea->buffer, entry, proven, operation);
    if (rc == 0)
        rc = readBody(fh, workArea, entry->size, operation);
    if (rc == 0)
        rc = checkEntryChecksum(workArea, entry, operation);
    if (rc == 0)
        rc = planSections(entry, proven, operation);
    return rc;
}

// --- Taking an entry out -------------------------------------------------------------------------

// Ends the text of at most length characters at text and copies it.
static void takeText(textBuffer* target, char* text, uint32_t length)
{
    text[length] = '\0';
    copyText(target, text, strlen(text));
}

static unsigned int compareTimestamp(const char* filter, const char* timestamp)
{
    int order = strncmp(filter, timestamp, timestampWidth);
    return order < 0 ? matchFilterEarlier : order > 0 ? matchFilterLater : matchFilterEqual;
}

void sqluhParseLogPosition(const char* text, uint8_t* position)
{
    memset(position, 0, sizeof zq3HistoryData::logPosition);
    for (uint32_t group = 0; group < 3; group++) {
        uint32_t value = 0;
        if (!hexDigitsAt(text + 4 * group, 4, &value))
            return;
        position[2 * group] = static_cast<uint8_t>(value >> 8);
        position[2 * group + 1] = static_cast<uint8_t>(value);
    }
}

static void takeLine2(zq3HistoryData* data, const sqluhFixedWords* words)
{
    for (unsigned int field = fieldObjectPart; field < fieldAuxCode; field++) {
        const sqluhEntryField& row = entryFields[field];
        char* member = reinterpret_cast<char*>(data) + row.member;
        const char* word = wordOfField(words, field);
        if (row.kind == kindLogPosition)
            sqluhParseLogPosition(word, data->logPosition);
        else
            copyText(reinterpret_cast<textBuffer*>(member), word, lengthOfWord(word, row.kind));
    }
}

static void takeNoteAndLongText(SQLUH_ENTRY* entry, char* record)
{
    if (entry->noteLength > maxNoteLength)
        entry->noteLength = maxNoteLength;
    takeText(&entry->data->noteText, record + entryNoteAt, entry->noteLength);
    if (entry->longTextLength == 0) {
        copyText(&entry->data->longText, "", 0);
        return;
    }
    if (entry->longTextLength > maxLongTextLength)
        entry->longTextLength = maxLongTextLength;
    takeText(&entry->data->longText, record + entryLongTextAt, entry->longTextLength);
}

static unsigned int takeObjectNames(SQLUH_ENTRY* entry, char* at, const char* qualifierFilter,
                                    const char* nameFilter)
{
    zq3HistoryData* data = entry->data;
    if (entry->qualifierLength == 0 && entry->nameLength == 0) {
        copyText(&data->qualifierText, "", 0);
        copyText(&data->nameText, "", 0);
        return 0;
    }
    char* name = at + entry->qualifierLength + 1;
    takeText(&data->qualifierText, at, entry->qualifierLength);
    takeText(&data->nameText, name, entry->nameLength);
    unsigned int flags = 0;
    if (qualifierFilter != nullptr && strcmp(at, qualifierFilter) == 0)
        flags |= matchQualifier;
    if (nameFilter != nullptr && strcmp(name, nameFilter) == 0)
        flags |= matchName;
    return flags;
}

// Takes count tablespace lines from at to at most end, storing the first of them in buffers.
// Returns the place after them, or null when a line is damaged.
static char* takeTablespaces(char* at, const char* end, uint32_t count, textBuffer* buffers,
                             uint32_t stored, const char* filter, unsigned int* flags)
{
    // One look for zero bytes, which end a name early, spares one for each name.
    bool zeroFree = stored != 0 && memchr(at, '\0', static_cast<size_t>(end - at)) == nullptr;
    uint64_t head = 0;
    uint64_t length = noTablespaceLength;
    for (uint32_t i = 0; i < count; i++) {
        if (!tablespaceFits(at, end, &head, &length))
            return nullptr;
        char* name = at + tablespaceNameAt;
        name[length] = '\0';
        if (i < stored)
            copyText(&buffers[i], name, zeroFree ? static_cast<size_t>(length) : strlen(name));
        if (filter != nullptr && strcmp(name, filter) == 0)
            *flags |= matchTablespace;
        at = name + length + 1;
    }
    return at;
}

// Whether the entry's lines are those of a neighbour, which were proven.
static bool linesAreKept(const sqluhProvenEntry* proven, const char* lines, uint32_t count)
{
    return count == proven->keptCount &&
           proven->keptLength <= proven->tablespacesEnd - proven->tablespacesAt &&
           memcmp(lines, proven->keptLines, proven->keptLength) == 0;
}

int sqluhPassTablespaces(const SQLUH_ENTRY* entry, const SQLUH_WORKAREA* workArea,
                         sqluhProvenEntry* proven, const char* operation)
{
    uint32_t count = entry->data->numTablespaces;
    const char* lines = workArea->buffer + proven->tablespacesAt;
    const char* at = lines;
    const char* end = workArea->buffer + proven->tablespacesEnd;
    uint64_t head = 0;
    uint64_t length = noTablespaceLength;
    if (linesAreKept(proven, lines, count)) {
        proven->tailAt = proven->tablespacesAt + proven->keptLength;
        return 0;
    }
    for (uint32_t i = 0; i < count; i++) {
        if (!tablespaceFits(at, end, &head, &length))
            return damagedLengths(entry, operation);
        at += length + tablespaceLineExtra;
    }
    proven->tailAt = static_cast<uint32_t>(at - workArea->buffer);
    uint32_t whole = static_cast<uint32_t>(at - lines);
    if (proven->fixed.forNeighbours && whole <= sizeof proven->keptLines) {
        memcpy(proven->keptLines, lines, whole);
        proven->keptLength = whole;
        proven->keptCount = count;
    }
    return 0;
}

// A number of the sqlca line. width: 10 or 11. Straight digits after an optional sign are what the
// writer writes.
static int32_t signedNumberAt(const char* text, uint32_t width)
{
    const char* last8 = text + width - 8;
    bool sign = text[0] == '+' || text[0] == '-';
    uint32_t low = 0;
    uint32_t high = 0;
    bool canonical = decimalColumns(last8, &low);
    for (const char* at = text + sign; at < last8; at++) {
        uint32_t digit = static_cast<uint32_t>(static_cast<unsigned char>(*at)) - '0';
        canonical &= digit <= 9;
        high = high * 10 + digit;
    }
    if (canonical) {
        uint64_t value = uint64_t{high} * 100000000 + low;
        return static_cast<int32_t>(text[0] == '-' ? 0 - value : value);
    }
    char digits[32];
    memcpy(digits, text, width);
    digits[width] = '\0';
    return static_cast<int32_t>(strtoll(digits, nullptr, 10));
}

void sqluhFillSqlca(sqlca* ca, const char* line)
{
    *ca = {};
    memcpy(ca->sqlcaid, line + sqlcaIdField.at, sqlcaIdField.width);
    ca->sqlcabc = signedNumberAt(line + sqlcaBcField.at, sqlcaBcField.width);
    ca->sqlcode = signedNumberAt(line + sqlcaCodeField.at, sqlcaCodeField.width);
    ca->sqlerrml =
        static_cast<int16_t>(numberAt(line + sqlcaErrmlField.at, sqlcaErrmlField.width, 16));
    memcpy(ca->sqlerrmc, line + sqlcaErrmcField.at, sqlcaErrmcField.width);
    memcpy(ca->sqlerrp, line + sqlcaErrpField.at, sqlcaErrpField.width);
    for (uint32_t i = 0; i < 6; i++)
        ca->sqlerrd[i] = signedNumberAt(line + sqlcaErrdField.at + i * sqlcaErrdField.width,
                                        sqlcaErrdField.width);
    memcpy(ca->sqlwarn, line + sqlcaWarnField.at, sqlcaWarnField.width);
    memcpy(ca->sqlstate, line + sqlcaStateField.at, sqlcaStateField.width);
    if (ca->sqlstate[0] == SQLUH_EMPTY_WORD[0])
        memset(ca->sqlstate, ' ', sizeof ca->sqlstate);
}

static unsigned int takeSqlca(sqlca* target, const char* line)
{
    if (target != nullptr)
        sqluhFillSqlca(target, line);
    int32_t code = signedNumberAt(line + sqlcaCodeField.at, sqlcaCodeField.width);
    return code != 0 ? unsigned{matchSqlcodeSet} : 0;
}

static void takeCommand(textBuffer* target, const char* lines, uint32_t length)
{
    target->length = length;
    if (target->data == nullptr || target->capacity == 0)
        return;
    uint32_t wanted = length < target->capacity ? length : target->capacity - 1;
    for (uint32_t done = 0; done < wanted; done += commandPieceLength) {
        uint32_t piece = wanted - done < commandPieceLength ? wanted - done : commandPieceLength;
        memcpy(target->data + done, lines, piece);
        lines += commandPieceLength + 1;
    }
    target->data[wanted] = '\0';
}

struct entryFilters {
    const char* timestamp;
    const char* qualifier;
    const char* name;
    const char* tablespace;
};

// Takes everything after the fixed part out of a proven entry, in the record's order.
static int takeSections(SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea, sqluhProvenEntry* proven,
                        const entryFilters* filters, uint32_t maxTablespaces, unsigned int* flags)
{
    zq3HistoryData* data = entry->data;
    char* record = workArea->buffer;
    const char* end = record + proven->tablespacesEnd;
    uint32_t stored = data->tablespaceBuffers != nullptr ? maxTablespaces : 0;
    if (filters->timestamp != nullptr)
        *flags |= compareTimestamp(filters->timestamp,
                                   wordOfField(&proven->fixed.words, fieldObjectPart));
    takeNoteAndLongText(entry, record);
    takeLine2(data, &proven->fixed.words);
    *flags |=
        takeObjectNames(entry, record + proven->objectNamesAt, filters->qualifier, filters->name);
    char* at = takeTablespaces(record + proven->tablespacesAt, end, data->numTablespaces,
                               data->tablespaceBuffers, stored, filters->tablespace, flags);
    if (at == nullptr)
        return damagedLengths(entry, readEntry);
    if (entry->sqlcaLength != 0) {
        *flags |= takeSqlca(data->eventSqlca, at);
        at += sqlcaLineLength;
    } else if (data->eventSqlca != nullptr) {
        sqloinca(data->eventSqlca);
    }
    takeCommand(&data->commandText, at, entry->commandLength);
    memcpy(data->eyecatcher, "SQLUHINF", sizeof data->eyecatcher);
    return 0;
}

// What is said about every entry that could not be read, whatever was found wrong with it.
static void logUnreadable(int rc, long long offset, const SQLUH_WORKAREA* workArea)
{
    if (rc >= 0 || rc == END_OF_FILE)
        return;
    pdLogPrintf(readEntry, pdLevelError, TEXT_ENTRY_OFFSET, offset);
    sqlt_logadmin(readEntry, pdAdminReadFailed);
    if (workArea->buffer != nullptr)
        sqlt_logerr_data(readEntry, TEXT_ENTRY_DUMP, workArea->buffer, workArea->size);
}

int sqluhCheckEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                    sqluhProvenEntry* proven)
{
    long long offset = 0;
    sqloseek(fh, 0, sqloFromCurrent, &offset);
    int rc = sqluhProveEntry(fh, entry, workArea, proven, readEntry);
    if (rc == 0)
        rc = sqluhPassTablespaces(entry, workArea, proven, readEntry);
    logUnreadable(rc, offset, workArea);
    return rc;
}

// Reads the entry at the file's position in full. *offset receives where it begins, *begun whether
// the file holds anything there.
static int readWholeEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                          const entryFilters* filters, unsigned int* flags, long long* offset,
                          bool* begun)
{
    uint32_t maxTablespaces = entry->data->maxTablespaces;
    sqluhProvenEntry proven;
    sqluhBeginProving(&proven, false);
    *flags = 0;
    // For the message: a file that cannot tell its position fails the read that follows.
    sqloseek(fh, 0, sqloFromCurrent, offset);

    int rc = sqluhProveEntry(fh, entry, workArea, &proven, readEntry);
    if (rc == 0)
        rc = takeSections(entry, workArea, &proven, filters, maxTablespaces, flags);
    if (rc == 0 && entry->data->numTablespaces > maxTablespaces)
        rc = TABLESPACE_LIST_TRUNCATED;
    logUnreadable(rc, *offset, workArea);
    *begun = proven.begun;
    return rc;
}

int sqluhReadEntry(SQLO_FHANDLE fh, SQLUH_ENTRY* entry, SQLUH_WORKAREA* workArea,
                   const char* timestampFilter, const char* qualifierFilter, const char* nameFilter,
                   const char* tablespaceFilter, unsigned int* matchFlags)
{
    pdtEntry();

    const entryFilters filters = {timestampFilter, qualifierFilter, nameFilter, tablespaceFilter};
    long long offset = 0;
    bool begun = false;
    int rc = readWholeEntry(fh, entry, workArea, &filters, matchFlags, &offset, &begun);

    pdtExit(rc);
    return rc;
}

int sqluhNextEntry(SQLUH_ENTRYWALK* walk)
{
    pdtEntry();

    static constexpr entryFilters noFilters = {nullptr, nullptr, nullptr, nullptr};
    unsigned int flags = 0;
    int rc = readWholeEntry(walk->file, walk->entry, walk->workArea, &noFilters, &flags,
                            &walk->offset, &walk->cutShort);
    // The reader's end of the file may also lie between an entry's fixed part and its body.
    walk->cutShort = walk->cutShort && rc == END_OF_FILE;
    if (rc == TABLESPACE_LIST_TRUNCATED)
        rc = 0;

    pdtExit(rc);
    return rc;
}
