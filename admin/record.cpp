// Records: their memory, and reading one from a history.
#include "admin/record.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>

static constexpr textBuffer zq3HistoryData::*textMembers[] = {
    &zq3HistoryData::objectPart, &zq3HistoryData::secondTimestamp, &zq3HistoryData::firstText,
    &zq3HistoryData::lastText,   &zq3HistoryData::idText,          &zq3HistoryData::qualifierText,
    &zq3HistoryData::nameText,   &zq3HistoryData::longText,        &zq3HistoryData::noteText,
    &zq3HistoryData::commandText};

historyRecord* newRecord(void)
{
    historyRecord* record = static_cast<historyRecord*>(calloc(1, sizeof *record));
    if (record != nullptr) {
        record->entry.data = &record->data;
        record->data.eventSqlca = &record->event;
        sqloinca(&record->event);
    }
    return record;
}

void freeRecord(historyRecord* record)
{
    if (record == nullptr)
        return;
    for (textBuffer zq3HistoryData::*text : textMembers)
        free((record->data.*text).data);
    for (uint32_t i = 0; i < record->data.maxTablespaces; i++)
        free(record->data.tablespaceBuffers[i].data);
    free(record->data.tablespaceBuffers);
    free(record);
}

// Makes room for a text of so many characters and the terminator.
static bool reserveText(textBuffer* text, uint32_t length)
{
    if (length < text->capacity)
        return true;
    if (length == UINT32_MAX)
        return false;
    char* grown = static_cast<char*>(realloc(text->data, size_t{length} + 1));
    if (grown == nullptr)
        return false;
    text->data = grown;
    text->capacity = length + 1;
    return true;
}

bool setText(textBuffer* text, const char* bytes, size_t length)
{
    if (length >= UINT32_MAX || !reserveText(text, static_cast<uint32_t>(length)))
        return false;
    memcpy(text->data, bytes, length);
    text->data[length] = '\0';
    text->length = static_cast<uint32_t>(length);
    return true;
}

// Makes room for so many names; those that are new are empty and without a buffer.
static bool reserveTablespaces(zq3HistoryData* data, uint32_t count)
{
    if (count <= data->maxTablespaces)
        return true;
    uint32_t capacity = count < UINT32_MAX / 2 ? count + count / 2 : count;
    textBuffer* grown = static_cast<textBuffer*>(
        reallocarray(data->tablespaceBuffers, capacity, sizeof(textBuffer)));
    if (grown == nullptr)
        return false;
    memset(grown + data->maxTablespaces, 0, (capacity - data->maxTablespaces) * sizeof *grown);
    data->tablespaceBuffers = grown;
    data->maxTablespaces = capacity;
    return true;
}

bool addTablespace(historyRecord* record, const char* bytes, size_t length)
{
    zq3HistoryData* data = &record->data;
    if (data->numTablespaces == UINT32_MAX || !reserveTablespaces(data, data->numTablespaces + 1) ||
        !setText(&data->tablespaceBuffers[data->numTablespaces], bytes, length))
        return false;
    data->numTablespaces++;
    return true;
}

void splitObjectPart(historyRecord* record)
{
    const textBuffer* text = &record->data.objectPart;
    const char* whole = text->length != 0 ? text->data : "";
    size_t length = strnlen(whole, timestampWidth);
    snprintf(record->timestamp, sizeof record->timestamp, "%.*s", static_cast<int>(length), whole);
    snprintf(record->sequence, sizeof record->sequence, "%s", whole + length);
}

bool joinObjectPart(historyRecord* record)
{
    char whole[sizeof record->timestamp + sizeof record->sequence];
    if (record->timestamp[0] == '\0')
        return true;
    snprintf(whole, sizeof whole, "%s%s", record->timestamp, record->sequence);
    return setText(&record->data.objectPart, whole, strlen(whole));
}

bool addRecord(historyList* list, historyRecord* record)
{
    if (list->count == list->capacity) {
        size_t capacity = list->capacity == 0 ? 64 : 2 * list->capacity;
        void* grown = reallocarray(list->records, capacity, sizeof *list->records);
        if (grown == nullptr)
            return false;
        list->records = static_cast<historyRecord**>(grown);
        list->capacity = capacity;
    }
    list->records[list->count++] = record;
    return true;
}

void freeList(historyList* list)
{
    for (size_t i = 0; i < list->count; i++)
        freeRecord(list->records[i]);
    free(list->records);
    *list = {};
}

// --- Reading -------------------------------------------------------------------------------------

// Whether the entry just read fitted; if not, makes room for what did not.
static int makeRoom(historyRecord* record, bool* fitted)
{
    zq3HistoryData* data = &record->data;
    *fitted = data->numTablespaces <= data->maxTablespaces;
    bool room = reserveTablespaces(data, data->numTablespaces);
    for (textBuffer zq3HistoryData::*member : textMembers) {
        textBuffer* text = &(data->*member);
        *fitted = *fitted && text->length < text->capacity;
        room = room && reserveText(text, text->length);
    }
    // Where there was no slot for a name, its length is not known yet either.
    for (uint32_t i = 0; *fitted && i < data->numTablespaces; i++)
        *fitted = data->tablespaceBuffers[i].length < data->tablespaceBuffers[i].capacity;
    for (uint32_t i = 0; room && i < data->numTablespaces; i++)
        room = reserveText(&data->tablespaceBuffers[i], data->tablespaceBuffers[i].length);
    return room ? 0 : sqloSystemError | ENOMEM;
}

int takeRow(const SQLUH_COMMITTED* committed, uint32_t row, historyRecord* record)
{
    bool fitted = false;
    int rc = 0;
    for (int round = 0; rc == 0 && !fitted && round < 4; round++) {
        rc = sqluhGetCommitted(committed, row, &record->entry, true);
        if (rc == 0 || rc == TABLESPACE_LIST_TRUNCATED)
            rc = makeRoom(record, &fitted);
    }
    if (rc == 0)
        splitObjectPart(record);
    return rc;
}
