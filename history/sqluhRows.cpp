// Rows in memory: each entry decoded once, its texts without the blanks that end them, its list of
// tablespaces shared with the entries that list the same. Stands on the reader of entries.

#include "history/sqluhRows.h"

#include <cerrno>
#include <new>

#include "history/sqluhDiagnostics.h"

// Memory is taken in chunks, each four times the last one's size: what a small history pays stays
// small, and pages of a large chunk cost nothing before they are used.
enum : size_t { firstChunk = 64 * 1024, chunkGrowth = 4, largestChunk = 16 * 1024 * 1024 };

struct sqluhChunk {
    sqluhChunk* next;
    size_t used; // of the bytes after this head
    size_t size;
};

// The tablespace lines of an entry as they stand in the file; they follow the places.
struct sqluhNameList {
    uint32_t count;
    uint32_t length; // of the lines in bytes
    bool zeroFree;   // no name ends early
    const char* lines;
};
// Where each name begins in the lines; one more place tells where the last one ends.
static const uint32_t* placesOf(const sqluhNameList* list)
{
    return reinterpret_cast<const uint32_t*>(list + 1);
}

// A text that ends a line of the record or stands on one.
struct packedText {
    uint32_t length; // up to the first zero byte, if any
    uint32_t stored; // without the blanks that end it
};
enum : unsigned int { packedNote, packedLongText, packedQualifier, packedName, packedTextCount };
static constexpr textBuffer zq3HistoryData::*packedMembers[packedTextCount] = {
    &zq3HistoryData::noteText, &zq3HistoryData::longText, &zq3HistoryData::qualifierText,
    &zq3HistoryData::nameText};

// Its words, its texts and its command stand after it, without terminators.
struct sqluhRow {
    const sqluhNameList* names; // null: none
    const sqlca* event;         // null: the entry has no sqlca line
    SQLUH_ENTRY entry;          // its lengths as they stand in the file; no data
    uint32_t entryNumber;
    uint32_t commandStored;
    packedText texts[packedTextCount];
    uint16_t entryNode;
    char status, operation;
    char optional[optionalLetterCount]; // as they stand in the file
    uint8_t logPosition[sizeof zq3HistoryData::logPosition];
    uint8_t wordLength[fixedWordCount]; // 0 for the log position
};

static constexpr size_t roundUp(size_t size)
{
    return (size + alignof(sqluhRow) - 1) / alignof(sqluhRow) * alignof(sqluhRow);
}

static void* takeSpace(sqluhRows* rows, size_t size, int* rc)
{
    size = roundUp(size);
    sqluhChunk* chunk = rows->chunks;
    if (chunk == nullptr || chunk->size - chunk->used < size) {
        size_t wanted = chunk == nullptr                            ? size_t{firstChunk}
                        : chunk->size >= largestChunk / chunkGrowth ? size_t{largestChunk}
                                                                    : chunk->size * chunkGrowth;
        void* block = nullptr;
        if (wanted < size)
            wanted = size;
        *rc = sqlogmblkEx(nullptr, sizeof *chunk + wanted, 0, &block, __FILE__, __LINE__, 0);
        if (*rc != 0)
            return nullptr;
        rows->chunks = new (block) sqluhChunk{chunk, 0, wanted};
        chunk = rows->chunks;
    }
    void* space = reinterpret_cast<char*>(chunk + 1) + chunk->used;
    chunk->used += size;
    return space;
}
static_assert(sizeof(sqluhChunk) % alignof(sqluhRow) == 0);

// Gives back what the space that was taken last does not need from end on.
static void giveBack(sqluhRows* rows, const char* end)
{
    const char* base = reinterpret_cast<const char*>(rows->chunks + 1);
    rows->chunks->used = roundUp(static_cast<size_t>(end - base));
}

static int reserveRow(sqluhRows* rows)
{
    if (rows->count < rows->capacity)
        return 0;
    void* block = rows->rows;
    uint32_t capacity = rows->capacity == 0 ? 64 : rows->capacity * 2;
    int rc = capacity < rows->capacity
                 ? sqloSystemError | ENOMEM
                 : sqloMemBlockReallocate(&block, size_t{capacity} * sizeof(sqluhRow*), 0, __FILE__,
                                          __LINE__);
    if (rc == 0) {
        rows->rows = static_cast<sqluhRow**>(block);
        rows->capacity = capacity;
    }
    return rc;
}

// --- What entries share --------------------------------------------------------------------------

// Whether the entry's tablespace lines begin with the lines of the list, which were proven.
static bool listsSame(const sqluhNameList* list, const char* lines, size_t room, uint32_t count)
{
    return list != nullptr && list->count == count && list->length <= room &&
           memcmp(list->lines, lines, list->length) == 0;
}

// Makes a list of proven lines.
static const sqluhNameList* makeNames(sqluhRows* rows, const char* lines, uint32_t length,
                                      uint32_t count, int* rc)
{
    size_t numPlaces = size_t{count} + 1;
    void* space =
        takeSpace(rows, sizeof(sqluhNameList) + numPlaces * sizeof(uint32_t) + length, rc);
    if (space == nullptr)
        return nullptr;
    sqluhNameList* list = static_cast<sqluhNameList*>(space);
    uint32_t* places = reinterpret_cast<uint32_t*>(list + 1);
    char* copy = reinterpret_cast<char*>(places + numPlaces);
    memcpy(copy, lines, length);
    *list = {count, length, memchr(lines, '\0', length) == nullptr, copy};

    uint64_t head = 0;
    uint64_t characters = noTablespaceLength;
    places[0] = tablespaceNameAt;
    for (uint32_t i = 0; i < count; i++) {
        const char* line = copy + places[i] - tablespaceNameAt;
        tablespaceFits(line, copy + length, &head, &characters);
        places[i + 1] = places[i] + static_cast<uint32_t>(characters) + tablespaceLineExtra;
    }
    return list;
}

// Finds or makes the list of the entry's names, proving lines that are not those of a list, and
// tells where they end.
static int shareNames(sqluhRows* rows, const SQLUH_ENTRY* entry, const SQLUH_WORKAREA* workArea,
                      sqluhProvenEntry* proven, const sqluhNameList** names)
{
    uint32_t count = entry->data->numTablespaces;
    char* lines = workArea->buffer + proven->tablespacesAt;
    proven->tailAt = proven->tablespacesAt;
    if (count == 0)
        return 0;
    int rc = 0;
    if (!listsSame(rows->lastNames, lines, proven->tablespacesEnd - proven->tablespacesAt, count)) {
        rc = sqluhPassTablespaces(entry, workArea, proven, nullptr);
        if (rc != 0)
            return rc;
        uint32_t length = proven->tailAt - proven->tablespacesAt;
        uint32_t sum = sqluhChecksum(lines, length);
        const sqluhNameList** known = &rows->lists[(sum ^ sum >> 16 ^ sum >> 8) % recentLists];
        if (!listsSame(*known, lines, length, count))
            *known = makeNames(rows, lines, length, count, &rc);
        rows->lastNames = *known;
    }
    *names = rows->lastNames;
    if (*names != nullptr)
        proven->tailAt = proven->tablespacesAt + (*names)->length;
    return rc;
}

static int shareEvent(sqluhRows* rows, const char* line, const sqlca** event)
{
    int rc = 0;
    if (rows->lastEvent == nullptr || memcmp(rows->lastEventLine, line, sqlcaLineLength) != 0) {
        sqlca* ca = static_cast<sqlca*>(takeSpace(rows, sizeof *ca, &rc));
        if (ca == nullptr)
            return rc;
        sqluhFillSqlca(ca, line);
        memcpy(rows->lastEventLine, line, sqlcaLineLength);
        rows->lastEvent = ca;
    }
    *event = rows->lastEvent;
    return rc;
}

// --- Packing -------------------------------------------------------------------------------------

static uint32_t lengthBeforeBlanks(const char* text, uint32_t length)
{
    static constexpr uint64_t blanks = 0x2020202020202020; // most lines are nothing else
    while (length >= sizeof blanks && columnsAt(text + length - sizeof blanks) == blanks)
        length -= static_cast<uint32_t>(sizeof blanks);
    while (length > 0 && text[length - 1] == ' ')
        length--;
    return length;
}

// Takes the command's pieces out of their lines, without the blanks that end it.
static uint32_t packCommand(char* target, const char* lines, uint32_t length)
{
    for (uint32_t done = 0; done < length; done += commandPieceLength) {
        uint32_t left = length - done;
        memcpy(target + done, lines, left < commandPieceLength ? left : commandPieceLength);
        lines += commandPieceLength + 1;
    }
    return lengthBeforeBlanks(target, length);
}

static packedText packText(char** target, const char* text, uint32_t length)
{
    packedText packed = {static_cast<uint32_t>(strnlen(text, length)), 0};
    packed.stored = lengthBeforeBlanks(text, packed.length);
    memcpy(*target, text, packed.stored);
    *target += packed.stored;
    return packed;
}

static void packNumbers(sqluhRow* row, const SQLUH_ENTRY* entry, const sqluhProvenEntry* proven)
{
    const zq3HistoryData* data = entry->data;
    row->entry = *entry;
    row->entry.data = nullptr;
    row->entryNumber = data->entryNumber;
    row->entryNode = data->entryNode;
    row->status = data->status;
    row->operation = data->operation;
    memcpy(row->optional, proven->optional, sizeof row->optional);
    sqluhParseLogPosition(wordOfField(&proven->fixed.words, fieldLogPosition), row->logPosition);
}

// Packs the texts of the record after the row. Returns where they end.
static char* packTexts(sqluhRow* row, const char* record, const sqluhProvenEntry* proven)
{
    char* at = reinterpret_cast<char*>(row + 1);
    const char* qualifier = record + proven->objectNamesAt;
    const char* name = qualifier + row->entry.qualifierLength + 1;
    bool named = row->entry.qualifierLength != 0 || row->entry.nameLength != 0;
    for (unsigned int field = fieldObjectPart; field < fieldAuxCode; field++) {
        const char* word = wordOfField(&proven->fixed.words, field);
        size_t length = lengthOfWord(word, entryFields[field].kind);
        row->wordLength[field - fieldObjectPart] = static_cast<uint8_t>(length);
        memcpy(at, word, length);
        at += length;
    }
    row->texts[packedNote] = packText(&at, record + entryNoteAt, lineTextLength);
    row->texts[packedLongText] =
        packText(&at, record + entryLongTextAt,
                 row->entry.longTextLength != 0 ? uint32_t{lineTextLength} : 0);
    row->texts[packedQualifier] = packText(&at, qualifier, named ? row->entry.qualifierLength : 0);
    row->texts[packedName] = packText(&at, name, named ? row->entry.nameLength : 0);
    row->commandStored = packCommand(
        at, record + proven->tailAt + (row->entry.sqlcaLength != 0 ? uint32_t{sqlcaLineLength} : 0),
        row->entry.commandLength);
    return at + row->commandStored;
}

int sqluhAddRow(sqluhRows* rows, const SQLUH_ENTRY* entry, const SQLUH_WORKAREA* workArea,
                sqluhProvenEntry* proven)
{
    const sqluhNameList* names = nullptr;
    const sqlca* event = nullptr;
    int rc = reserveRow(rows);
    if (rc == 0)
        rc = shareNames(rows, entry, workArea, proven, &names);
    if (rc == 0 && entry->sqlcaLength != 0)
        rc = shareEvent(rows, workArea->buffer + proven->tailAt, &event);
    if (rc != 0)
        return rc;

    // Packed, a record is never longer than it was; what it does not need goes back.
    size_t most = sizeof(sqluhRow) + entry->size;
    void* space = takeSpace(rows, most, &rc);
    if (space == nullptr)
        return rc;
    sqluhRow* row = new (space) sqluhRow{};
    row->names = names;
    row->event = event;
    packNumbers(row, entry, proven);
    char* end = packTexts(row, workArea->buffer, proven);
    giveBack(rows, end);
    rows->rows[rows->count++] = row;
    if (entry->data->numTablespaces > rows->maxTablespaces)
        rows->maxTablespaces = entry->data->numTablespaces;
    return 0;
}

// --- Taking a row out ----------------------------------------------------------------------------

// Copies a packed text of which length characters are wanted: what is not stored of them is blank.
static const char* unpackText(textBuffer* target, const char* stored, packedText packed,
                              uint32_t length)
{
    target->length = packed.length < length ? packed.length : length;
    if (target->data != nullptr && target->capacity != 0) {
        uint32_t copied = target->length < target->capacity ? target->length : target->capacity - 1;
        uint32_t there = packed.stored < copied ? packed.stored : copied;
        memcpy(target->data, stored, there);
        memset(target->data + there, ' ', copied - there);
        target->data[copied] = '\0';
    }
    return stored + packed.stored;
}

// The length of a line's text as it was given to the writer: what the entry states, unless the line
// holds more or has no room for it.
static uint32_t writtenLength(packedText packed, uint32_t stated)
{
    return stated >= packed.stored && stated <= lineTextLength ? stated : packed.stored;
}

static void unpackNames(zq3HistoryData* data, const sqluhNameList* list)
{
    const uint32_t* places = placesOf(list);
    uint32_t stored = data->tablespaceBuffers == nullptr   ? 0
                      : list->count < data->maxTablespaces ? list->count
                                                           : data->maxTablespaces;
    for (uint32_t i = 0; i < stored; i++) {
        const char* name = list->lines + places[i];
        uint32_t length = places[i + 1] - places[i] - tablespaceLineExtra;
        if (!list->zeroFree)
            length = static_cast<uint32_t>(strnlen(name, length));
        copyText(&data->tablespaceBuffers[i], name, length);
    }
}

static char letterOf(char written, bool asWritten)
{
    return written == SQLUH_EMPTY_WORD[0] && !asWritten ? ' ' : written;
}

static void unpackNumbers(const sqluhRow* row, SQLUH_ENTRY* entry, bool asWritten)
{
    zq3HistoryData* data = entry->data;
    *entry = row->entry;
    entry->data = data;
    data->entryNumber = row->entryNumber;
    data->entryNode = row->entryNode;
    data->numTablespaces = row->names != nullptr ? row->names->count : 0;
    data->status = row->status;
    data->operation = row->operation;
    data->object = letterOf(row->optional[0], asWritten);
    data->operationType = letterOf(row->optional[1], asWritten);
    data->auxCode = letterOf(row->optional[2], asWritten);
    memcpy(data->logPosition, row->logPosition, sizeof data->logPosition);
    memcpy(data->eyecatcher, "SQLUHINF", sizeof data->eyecatcher);
    if (data->eventSqlca != nullptr && row->event != nullptr)
        *data->eventSqlca = *row->event;
    else if (data->eventSqlca != nullptr)
        sqloinca(data->eventSqlca);
}

// The words of the fixed part. Returns where they end.
static const char* unpackWords(const sqluhRow* row, zq3HistoryData* data)
{
    const char* at = reinterpret_cast<const char*>(row + 1);
    for (unsigned int field = fieldObjectPart; field < fieldAuxCode; field++) {
        char* member = reinterpret_cast<char*>(data) + entryFields[field].member;
        uint8_t length = row->wordLength[field - fieldObjectPart];
        if (field != fieldLogPosition)
            copyText(reinterpret_cast<textBuffer*>(member), at, length);
        at += length;
    }
    return at;
}

int sqluhTakeRow(const sqluhRow* row, SQLUH_ENTRY* entry, bool asWritten)
{
    uint32_t maxTablespaces = entry->data->maxTablespaces;
    unpackNumbers(row, entry, asWritten);
    zq3HistoryData* data = entry->data;
    uint32_t lengths[packedTextCount] = {
        writtenLength(row->texts[packedNote], entry->noteLength),
        writtenLength(row->texts[packedLongText], entry->longTextLength), entry->qualifierLength,
        entry->nameLength};
    if (!asWritten) {
        if (entry->noteLength > maxNoteLength)
            entry->noteLength = maxNoteLength;
        if (entry->longTextLength > maxLongTextLength)
            entry->longTextLength = maxLongTextLength;
        lengths[packedNote] = entry->noteLength;
        lengths[packedLongText] = entry->longTextLength;
    }
    const char* at = unpackWords(row, data);
    for (unsigned int i = 0; i < packedTextCount; i++)
        at = unpackText(&(data->*packedMembers[i]), at, row->texts[i], lengths[i]);
    unpackText(&data->commandText, at, {entry->commandLength, row->commandStored},
               entry->commandLength);
    if (row->names != nullptr)
        unpackNames(data, row->names);
    return data->numTablespaces > maxTablespaces ? TABLESPACE_LIST_TRUNCATED : 0;
}

void sqluhFreeRows(sqluhRows* rows)
{
    while (rows->chunks != nullptr) {
        sqluhChunk* next = rows->chunks->next;
        sqlofmblkEx(rows->chunks);
        rows->chunks = next;
    }
    sqlofmblkEx(rows->rows);
    *rows = {};
}
