// Writing stanzas: what a reader would fill in by itself is left out.
#include <cstring>

#include "admin/fields.h"
#include "admin/stanza.h"
#include "admin/zq3hist.h"

// A value of any bytes. Blanks at its ends would be lost, so they are escaped as well.
static void putValue(FILE* out, const char* name, const char* text, size_t length)
{
    fprintf(out, "%s: ", name);
    if (length != 0 && text[0] == ' ') {
        fputs("\\x20", out);
        text++, length--;
    }
    bool blankAtEnd = length != 0 && text[length - 1] == ' ';
    putEscaped(out, text, length - blankAtEnd);
    fputs(blankAtEnd ? "\\x20\n" : "\n", out);
}

static void putLetter(FILE* out, const letterField* field, char letter)
{
    const char* word = wordForLetter(field, letter);
    if (word != nullptr)
        putValue(out, field->name, word, strlen(word));
    else
        putValue(out, field->name, &letter, 1);
}

// A timestamp is 14 digits unless its first character is escaped.
static void putTimestamp(FILE* out, const char* name, const char* text, size_t length)
{
    if (length == timestampWidth && strspn(text, "0123456789") >= timestampWidth) {
        putValue(out, name, text, length);
    } else {
        fprintf(out, "%s: \\x%02X", name, static_cast<unsigned char>(text[0]));
        putEscaped(out, text + 1, length - 1);
        putc('\n', out);
    }
}

static void putObjectPart(FILE* out, const textBuffer* objectPart)
{
    if (objectPart->length == 0)
        return;
    size_t length = objectPart->length < timestampWidth ? objectPart->length : timestampWidth;
    const char* sequence = objectPart->data + length;
    putTimestamp(out, FIELD_TIMESTAMP, objectPart->data, length);
    if (strcmp(sequence, DEFAULT_SEQUENCE) != 0)
        putValue(out, FIELD_SEQUENCE, sequence, strlen(sequence));
}

static void putText(FILE* out, const historyRecord* record, const textField* field)
{
    const textBuffer* text = &(record->data.*field->text);
    uint32_t length = text->length < text->capacity ? text->length : 0;
    if (field->limit == timestampWidth && length != 0)
        putTimestamp(out, field->name, text->data, length);
    else if (length != 0)
        putValue(out, field->name, text->data, length);
}

static void putNumber(FILE* out, const char* name, long long number)
{
    fprintf(out, "%s: %lld\n", name, number);
}

static void putSqlca(FILE* out, const sqlca* event)
{
    sqlca usual;
    uint32_t tokensLength = 0;
    sqloinca(&usual);
    putNumber(out, sqlcaFields[0].name, event->sqlcode);
    for (const sqlcaField& field : sqlcaFields) {
        const char* member = reinterpret_cast<const char*>(event) + field.at;
        if (&field == &sqlcaFields[0] || isSameInFile(&field, event, &usual))
            continue;
        if (field.isText) {
            uint32_t length = field.count;
            while (length > 0 && member[length - 1] == ' ')
                length--;
            putValue(out, field.name, member, length);
            if (field.at == offsetof(sqlca, sqlerrmc))
                tokensLength = length;
            continue;
        }
        fprintf(out, "%s:", field.name);
        for (uint32_t i = 0; i < field.count; i++) {
            int32_t number;
            memcpy(&number, member + i * sizeof number, sizeof number);
            fprintf(out, " %d", number);
        }
        putc('\n', out);
    }
    if (event->sqlerrml != static_cast<int16_t>(tokensLength))
        putNumber(out, FIELD_TOKENS_LENGTH, event->sqlerrml);
}

void writeStanza(FILE* out, const historyRecord* record)
{
    const zq3HistoryData* data = &record->data;
    static constexpr uint8_t noPosition[sizeof data->logPosition] = {};
    for (const letterField& field : letterFields) {
        char letter = data->*field.letter;
        if (&field == &letterFields[0] || letter != defaultLetter(&field, data->operation))
            putLetter(out, &field, letter);
    }
    putObjectPart(out, &data->objectPart);
    for (const textField& field : textFields)
        putText(out, record, &field);
    uint32_t noteLength = record->entry.noteLength;
    if (noteLength != data->noteText.length || noteLength > maxNoteLength)
        putNumber(out, FIELD_NOTE_LENGTH, noteLength);
    if (record->entry.longTextLength != data->longText.length)
        putNumber(out, FIELD_LONG_TEXT_LENGTH, record->entry.longTextLength);
    if (memcmp(data->logPosition, noPosition, sizeof noPosition) != 0) {
        fputs(FIELD_LOG_POSITION ": ", out);
        for (uint8_t byte : data->logPosition)
            fprintf(out, "%02X", byte);
        putc('\n', out);
    }
    putNumber(out, FIELD_NODE, data->entryNode);
    putNumber(out, FIELD_NUMBER, data->entryNumber);
    for (uint32_t i = 0; i < data->numTablespaces; i++)
        putValue(out, FIELD_TABLESPACE, data->tablespaceBuffers[i].data,
                 data->tablespaceBuffers[i].length);
    if (record->entry.sqlcaLength != 0)
        putSqlca(out, &record->event);
    putc('\n', out);
}
