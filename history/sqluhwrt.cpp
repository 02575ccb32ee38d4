// Writing entries. Stands on the primitives and on the recording of a batch's writes.

#include <cstdio>
#include <cstring>

#include "history/sqluhDiagnostics.h"
#include "history/sqluhist.h"

static constexpr char writeEntry[] = "sqluhWriteEntry"; // the operation that the log names

// The record being formatted. length counts what the sections come to, also where they no longer
// fit, so that the mismatch with size can be told in full; nothing is formatted past text[size].
struct entryText {
    char* text;
    uint32_t size;
    uint32_t length;
};

// Reserves the place of a section of the given length; null when it does not fit.
static char* sectionAt(entryText* record, uint32_t length)
{
    char* at = record->text + record->length;
    bool fits = uint64_t{record->length} + length <= record->size;
    record->length += length;
    return fits ? at : nullptr;
}

// A missing text counts as an empty one, which the widths pad with blanks.
static const char* textOf(const textBuffer* text)
{
    return text->data != nullptr ? text->data : "";
}

static const char* wordOr(const textBuffer* text, const char* empty)
{
    const char* word = textOf(text);
    return word[0] == '\0' || word[0] == ' ' ? empty : word;
}

static char letterOr(char letter)
{
    return letter != '\0' ? letter : SQLUH_EMPTY_WORD[0];
}

static void completeTablespaceNames(const zq3HistoryData* data)
{
    for (uint32_t i = 0; i < data->numTablespaces; i++) {
        textBuffer* name = &data->tablespaceBuffers[i];
        if (name->length == 0 && name->data != nullptr)
            name->length = static_cast<uint32_t>(strlen(name->data));
    }
}

// In 64 bits: lengths that do not add up in 32 must not pass for a small record.
static uint64_t entrySize(const SQLUH_ENTRY* entry)
{
    const zq3HistoryData* data = entry->data;
    uint64_t size = entryMinLength;
    if (entry->longTextLength != 0)
        size += lineLength;
    if (entry->qualifierLength != 0 || entry->nameLength != 0)
        size += (uint64_t{entry->qualifierLength} + 1) + (uint64_t{entry->nameLength} + 1);
    for (uint32_t i = 0; i < data->numTablespaces; i++)
        size += uint64_t{data->tablespaceBuffers[i].length} + tablespaceLineExtra;
    size += entry->sqlcaLength;
    if (entry->commandLength != 0)
        size +=
            uint64_t{entry->commandLength} + (entry->commandLength - 1) / commandPieceLength + 1;
    return size;
}

static void formatFixedPart(entryText* record, const SQLUH_ENTRY* entry)
{
    const zq3HistoryData* data = entry->data;
    const uint8_t* position = data->logPosition;
    char positionText[2 * sizeof data->logPosition + 1];
    snprintf(positionText, sizeof positionText, logPositionFormat, position[0], position[1],
             position[2], position[3], position[4], position[5]);
    char* at = sectionAt(record, entryFixedLength);
    sqluhSprintf(
        at, entryFormat, entry->checksum, data->entryNode, data->entryNumber, entry->size,
        entry->version, data->status, entry->noteLength, entry->longTextLength,
        entry->qualifierLength, entry->nameLength, data->numTablespaces, entry->sqlcaLength,
        entry->commandLength, " ", data->operation, letterOr(data->object),
        letterOr(data->operationType), wordOr(&data->objectPart, SQLUH_EMPTY_TIMESTAMP),
        wordOr(&data->secondTimestamp, SQLUH_EMPTY_TIMESTAMP),
        wordOr(&data->firstText, SQLUH_EMPTY_WORD), wordOr(&data->lastText, SQLUH_EMPTY_WORD),
        positionText, wordOr(&data->idText, SQLUH_EMPTY_WORD), letterOr(data->auxCode), " ");
}

static void formatLine(entryText* record, const textBuffer* text)
{
    char* at = sectionAt(record, lineLength);
    sqluhSprintf(at, lineFormat, textOf(text));
}

static void formatObjectNames(entryText* record, const SQLUH_ENTRY* entry)
{
    int qualifierLength = static_cast<int>(entry->qualifierLength);
    int nameLength = static_cast<int>(entry->nameLength);
    char* at = sectionAt(record, entry->qualifierLength + entry->nameLength + 2);
    sqluhSprintf(at, objectNamesFormat, qualifierLength, qualifierLength,
                 textOf(&entry->data->qualifierText), nameLength, nameLength,
                 textOf(&entry->data->nameText));
}

static void formatTablespaces(entryText* record, const zq3HistoryData* data)
{
    for (uint32_t i = 0; i < data->numTablespaces; i++) {
        const textBuffer* name = &data->tablespaceBuffers[i];
        int length = static_cast<int>(name->length);
        char* at = sectionAt(record, name->length + tablespaceLineExtra);
        sqluhSprintf(at, tablespaceFormat, name->length, length, length, textOf(name));
    }
}

static const char* sqlcaTextOr(const char* text)
{
    return text[0] == '\0' || text[0] == ' ' ? SQLUH_EMPTY_WORD : text;
}

// The one section whose length does not follow from the entry's numbers: a negative byte count
// makes it longer. It is formatted aside and copied as far as it fits.
static void formatSqlca(entryText* record, const sqlca* event)
{
    sqlca initial;
    const sqlca* ca = event;
    if (ca == nullptr) {
        sqloinca(&initial);
        ca = &initial;
    }
    char line[2 * sqlcaLineLength];
    const char* tokens = ca->sqlerrml != 0 ? sqlcaTextOr(ca->sqlerrmc) : SQLUH_EMPTY_WORD;
    const char* warn = ca->sqlwarn;
    int length =
        sqluhSprintf(line, sqlcaFormat, ca->sqlcaid, ca->sqlcabc, ca->sqlcode,
                     static_cast<unsigned short>(ca->sqlerrml), tokens, sqlcaTextOr(ca->sqlerrp),
                     ca->sqlerrd[0], ca->sqlerrd[1], ca->sqlerrd[2], ca->sqlerrd[3], ca->sqlerrd[4],
                     ca->sqlerrd[5], warn[0], warn[1], warn[2], warn[3], warn[4], warn[5], warn[6],
                     warn[7], warn[8], warn[9], warn[10], sqlcaTextOr(ca->sqlstate));
    char* at = sectionAt(record, static_cast<uint32_t>(length));
    if (at != nullptr)
        memcpy(at, line, static_cast<uint32_t>(length));
}

// A text that is shorter than its length is padded; nothing after its end is read.
static void formatCommand(entryText* record, const SQLUH_ENTRY* entry)
{
    const char* text = textOf(&entry->data->commandText);
    size_t available = strnlen(text, entry->commandLength);
    for (uint32_t done = 0; done < entry->commandLength; done += commandPieceLength) {
        uint32_t left = entry->commandLength - done;
        int piece = static_cast<int>(left < commandPieceLength ? left : commandPieceLength);
        char* at = sectionAt(record, static_cast<uint32_t>(piece) + 1);
        if (at != nullptr)
            sqluhSprintf(at, commandPieceFormat, piece, piece, done < available ? text + done : "");
    }
}

static void formatEntry(entryText* record, const SQLUH_ENTRY* entry)
{
    const zq3HistoryData* data = entry->data;
    formatFixedPart(record, entry);
    formatLine(record, &data->noteText);
    if (entry->longTextLength != 0)
        formatLine(record, &data->longText);
    if (entry->qualifierLength != 0 || entry->nameLength != 0)
        formatObjectNames(record, entry);
    formatTablespaces(record, data);
    if (entry->sqlcaLength != 0)
        formatSqlca(record, data->eventSqlca);
    formatCommand(record, entry);
}

static int refuseSizeMismatch(const entryText* record)
{
    char message[81] = {};
    sqluhSprintf(message, TEXT_ENTRY_SIZE, static_cast<int>(record->length),
                 static_cast<int>(record->size));
    logRecord({textItem(message), codeItem("rc = ", HISTORY_FILE_DAMAGED)}, writeEntry);
    sqltError(writeEntry, HISTORY_FILE_DAMAGED);
    if (record->text != nullptr)
        sqlt_logerr_data(writeEntry, TEXT_ENTRY_DUMP, record->text, record->size);
    return HISTORY_FILE_DAMAGED;
}

static void stampChecksum(SQLUH_ENTRY* entry, char* text)
{
    char digits[9];
    entry->checksum = sqluhChecksum(text, entry->size);
    sqluhSprintf(digits, checksumFormat, entry->checksum);
    memcpy(text, digits, entryFields[fieldChecksum].width);
}

// Writes the finished record and records the write for replay.
static int writeEntryText(SQLUH_HANDLE* handle, const entryText* record)
{
    long long offset = 0;
    uint32_t written = 0;
    int rc = logged(sqloseek(handle->fileHandle, 0, sqloFromCurrent, &offset), writeEntry);
    if (rc != 0)
        return rc;
    rc = logged(sqlowrite(handle->fileHandle, record->text, record->size, &written), writeEntry);
    if (rc == DISK_FULL)
        sqlt_logadmin(writeEntry, pdAdminDiskFull);
    if (rc == 0 && written != record->size)
        sqltError(writeEntry, transferCode(rc)); // not logged: the caller is told
    if (rc != 0 || written != record->size)
        return transferCode(rc);

    int recorded = sqluhAddReplayEntry(&handle->replayArea, offset, record->size, record->text,
                                       handle->header.entryCount);
    if (recorded != 0) {
        // The record is in the file; the end of the batch copies the whole file instead.
        handle->replayArea.replayDisabled = 1;
        sqltError(writeEntry, recorded);
    }
    return 0;
}

int sqluhWriteEntry(SQLUH_HANDLE* handle, SQLUH_ENTRY* entry)
{
    pdtEntry();

    bool namesMissing =
        entry->data->numTablespaces != 0 && entry->data->tablespaceBuffers == nullptr;
    entry->version = currentVersion;
    if (!namesMissing)
        completeTablespaceNames(entry->data);
    uint64_t size = namesMissing ? 0 : entrySize(entry);
    entry->size = static_cast<uint32_t>(size);
    entryText record = {nullptr, entry->size, 0};
    int rc = 0;

    if (namesMissing || size > INT32_MAX) {
        // Field widths are ints; such a record is refused before memory is asked for it.
        rc = refuseSizeMismatch(&record);
    } else {
        void* block = nullptr;
        rc = logged(allocateZeroed(size_t{entry->size} + 1, &block));
        if (rc == 0) {
            record.text = static_cast<char*>(block);
            entry->checksum = 0;
            formatEntry(&record, entry);
            if (record.length != entry->size ||
                (entry->sqlcaLength != 0 && entry->sqlcaLength != sqlcaLineLength)) {
                rc = refuseSizeMismatch(&record);
            } else {
                stampChecksum(entry, record.text);
                rc = writeEntryText(handle, &record);
            }
            sqlofmblkEx(block);
        }
    }

    pdtExit(rc);
    return rc;
}
