// Reading and writing stanzas.
//
// A line is a comment (its first character is #), or empty, which ends an entry, or "Field: value".
// White space around field and value counts for nothing. In a value \n, \t and \\ stand for a line
// feed, a tab and a backslash, and \xHH for the byte with that number: so every text can be given.
#include "admin/stanza.h"

#include <cerrno>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <strings.h>

#include "admin/fields.h"
#include "history/sqluhColumns.h"

struct stanzaReader {
    const char* at;
    const char* end;
    unsigned int line;
    uint16_t node;
    historyList* list;
    stanzaMistake* mistake;
    char* escaped; // room for the current line's value
    fieldValue value;

    // The entry being read.
    historyRecord* record; // null between entries
    unsigned int firstLine;
    unsigned int noteLine; // of its note, which is refused by its length at the end
    uint32_t seen;         // a bit for each field
};
static_assert(numRecordFields <= 32);

static constexpr int noMemory = sqloSystemError | ENOMEM;

static int mistakeAt(stanzaReader* reader, unsigned int line, const char* found, size_t length,
                     const char* format, ...) __attribute__((format(printf, 5, 6)));
static int mistakeAt(stanzaReader* reader, unsigned int line, const char* found, size_t length,
                     const char* format, ...)
{
    stanzaMistake* mistake = reader->mistake;
    va_list arguments;
    mistake->line = line;
    mistake->foundLength = length < sizeof mistake->found ? length : sizeof mistake->found;
    memcpy(mistake->found, found, mistake->foundLength);
    va_start(arguments, format);
    vsnprintf(mistake->expected, sizeof mistake->expected, format, arguments);
    va_end(arguments);
    return stanzaMistaken;
}

// --- Values --------------------------------------------------------------------------------------

// Takes the escape at *at, after its backslash. False when there is no such escape.
static bool takeEscape(const char** at, const char* end, char* c)
{
    if (*at == end)
        return false;
    char letter = *(*at)++;
    if (letter == 'x') {
        uint32_t byte = 0;
        if (end - *at < 2 || !hexDigitsAt(*at, 2, &byte))
            return false;
        *c = static_cast<char>(byte);
        *at += 2;
        return true;
    }
    *c = letter == 'n' ? '\n' : letter == 't' ? '\t' : letter;
    return letter == 'n' || letter == 't' || letter == '\\';
}

static int takeValue(stanzaReader* reader, const char* at, const char* end)
{
    fieldValue* value = &reader->value;
    *value = {reader->escaped, 0, true, ""};
    while (at != end) {
        const char* from = at;
        char c = *at++;
        if (c == '\\') {
            value->isPlain = false;
            if (!takeEscape(&at, end, &c))
                return mistakeAt(reader, reader->line, from, static_cast<size_t>(end - from),
                                 "one of the escapes \\n, \\t, \\\\ and \\xHH");
        }
        reader->escaped[value->length++] = c;
    }
    reader->escaped[value->length] = '\0';
    return 0;
}

// --- Entries -------------------------------------------------------------------------------------

static int beginEntry(stanzaReader* reader)
{
    reader->record = newRecord();
    if (reader->record == nullptr)
        return noMemory;
    reader->record->data.entryNode = reader->node;
    reader->record->numberByPlace = true;
    reader->firstLine = reader->line;
    reader->seen = 0;
    return 0;
}

static int endEntry(stanzaReader* reader)
{
    int rc = 0;
    if (reader->record == nullptr)
        return 0;
    for (unsigned int i = 0; rc == 0 && i < numRecordFields; i++) {
        const recordField* field = &recordFields[i];
        reader->value = {"", 0, true, ""};
        if (field->settle != nullptr && (reader->seen >> i & 1) == 0)
            rc = field->settle(field, reader->record, &reader->value);
    }
    if (rc == valueRefused)
        return mistakeAt(reader, reader->value.length != 0 ? reader->noteLine : reader->firstLine,
                         reader->value.text, reader->value.length, "%s", reader->value.expected);
    if (rc == 0 && (!joinObjectPart(reader->record) || !addRecord(reader->list, reader->record)))
        rc = noMemory;
    if (rc == 0)
        reader->record = nullptr;
    return rc;
}

// --- Lines ---------------------------------------------------------------------------------------

static void trim(const char** from, const char** to)
{
    while (*from != *to && isWhite(**from))
        ++*from;
    while (*from != *to && isWhite((*to)[-1]))
        --*to;
}

static unsigned int findField(const char* name, size_t length)
{
    unsigned int i = 0;
    while (i < numRecordFields && (strlen(recordFields[i].name) != length ||
                                   strncasecmp(recordFields[i].name, name, length) != 0))
        i++;
    return i;
}

static int takeField(stanzaReader* reader, unsigned int number)
{
    const recordField* field = &recordFields[number];
    reader->seen |= uint32_t{1} << number;
    if (field->at == offsetof(historyRecord, data.noteText))
        reader->noteLine = reader->line;
    if (isInSqlca(field))
        reader->record->entry.sqlcaLength = sqlcaLineLength;
    int rc = field->take(field, reader->record, &reader->value);
    return rc != valueRefused ? rc
                              : mistakeAt(reader, reader->line, reader->value.text,
                                          reader->value.length, "%s", reader->value.expected);
}

static int takeLine(stanzaReader* reader, const char* from, const char* to)
{
    const char* colon = static_cast<const char*>(memchr(from, ':', static_cast<size_t>(to - from)));
    if (colon == nullptr)
        return mistakeAt(reader, reader->line, from, static_cast<size_t>(to - from),
                         "a line of the form Field: value");
    const char* nameEnd = colon;
    const char* value = colon + 1;
    trim(&from, &nameEnd);
    trim(&value, &to);
    size_t nameLength = static_cast<size_t>(nameEnd - from);
    unsigned int field = findField(from, nameLength);
    if (field == numRecordFields)
        return mistakeAt(reader, reader->line, from, nameLength,
                         "a field such as Operation, Timestamp or Tablespace");
    int rc = reader->record == nullptr ? beginEntry(reader) : 0;
    if (rc == 0 && (reader->seen >> field & 1) != 0 && recordFields[field].form != formNames)
        return mistakeAt(reader, reader->line, from, nameLength,
                         "each field but Tablespace once in an entry");
    if (rc == 0)
        rc = takeValue(reader, value, to);
    return rc == 0 ? takeField(reader, field) : rc;
}

static int takeLines(stanzaReader* reader)
{
    int rc = 0;
    while (rc == 0 && reader->at != reader->end) {
        size_t left = static_cast<size_t>(reader->end - reader->at);
        const char* from = reader->at;
        const char* feed = static_cast<const char*>(memchr(from, '\n', left));
        const char* to = feed != nullptr ? feed : reader->end;
        reader->at = feed != nullptr ? feed + 1 : reader->end;
        reader->line++;
        trim(&from, &to);
        if (from == to)
            rc = endEntry(reader);
        else if (*from != '#')
            rc = takeLine(reader, from, to);
    }
    return rc == 0 ? endEntry(reader) : rc;
}

int readStanzas(const char* text, size_t length, uint16_t node, historyList* list,
                stanzaMistake* mistake)
{
    stanzaReader reader = {};
    reader.at = text;
    reader.end = text + length;
    reader.node = node;
    reader.list = list;
    reader.mistake = mistake;
    // No value is longer than the text.
    reader.escaped = static_cast<char*>(calloc(length + 1, 1));
    int rc = reader.escaped == nullptr ? noMemory : takeLines(&reader);
    freeRecord(reader.record);
    free(reader.escaped);
    return rc;
}

// --- Writing -------------------------------------------------------------------------------------

static void writeFields(FILE* out, const historyRecord* record, bool withNumber)
{
    for (const recordField& field : recordFields)
        if ((withNumber || field.at != offsetof(historyRecord, data.entryNumber)) &&
            (!isInSqlca(&field) || record->entry.sqlcaLength != 0))
            putField(&field, record, out);
    putc('\n', out);
}

void writeStanza(FILE* out, const historyRecord* record)
{
    writeFields(out, record, true);
}

void writeUnnumbered(FILE* out, const historyRecord* record)
{
    writeFields(out, record, false);
}

void writeJson(FILE* out, const historyRecord* record)
{
    jsonWriter json = {out, false};
    bool withSqlca = record->entry.sqlcaLength != 0;
    bool inSqlca = false;
    beginJson(&json, nullptr, '{');
    putJsonNumber(&json, "format", 1);
    for (const recordField& field : recordFields) {
        if (field.key == nullptr)
            continue;
        if (isInSqlca(&field) && !inSqlca && withSqlca)
            beginJson(&json, "sqlca", '{');
        inSqlca = isInSqlca(&field);
        if (!inSqlca || withSqlca)
            putJsonField(&field, record, &json);
    }
    if (withSqlca)
        endJson(&json, '}');
    else
        putJsonText(&json, "sqlca", nullptr);
    endJsonLine(&json);
}
