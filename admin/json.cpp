// Writing JSON.
#include <cstring>

#include "admin/fields.h"
#include "admin/stanza.h"

void putJsonText(FILE* out, const char* text, size_t length)
{
    putc('"', out);
    for (size_t i = 0; i < length; i++) {
        unsigned char c = static_cast<unsigned char>(text[i]);
        if (c == '"' || c == '\\')
            fprintf(out, "\\%c", c);
        else if (c < 0x20 || c > 0x7E)
            fprintf(out, "\\u%04X", c);
        else
            putc(c, out);
    }
    putc('"', out);
}

static void putKey(FILE* out, const char* key)
{
    fprintf(out, ",\"%s\":", key);
}

static void putBuffer(FILE* out, const textBuffer* text)
{
    putJsonText(out, text->data, text->length < text->capacity ? text->length : 0);
}

static void putSqlca(FILE* out, const sqlca* event)
{
    putc('{', out);
    for (const sqlcaField& field : sqlcaFields) {
        const char* member = reinterpret_cast<const char*>(event) + field.at;
        fprintf(out, "%s\"%s\":", &field == &sqlcaFields[0] ? "" : ",", field.key);
        if (field.isText) {
            putJsonText(out, member, field.count);
            continue;
        }
        fputs(field.count > 1 ? "[" : "", out);
        for (uint32_t i = 0; i < field.count; i++) {
            int32_t number;
            memcpy(&number, member + i * sizeof number, sizeof number);
            fprintf(out, "%s%d", i == 0 ? "" : ",", number);
        }
        fputs(field.count > 1 ? "]" : "", out);
    }
    fprintf(out, ",\"tokensLength\":%d}", event->sqlerrml);
}

void writeJson(FILE* out, const historyRecord* record)
{
    const zq3HistoryData* data = &record->data;
    const textBuffer* objectPart = &data->objectPart;
    uint32_t timestampLength =
        objectPart->length < timestampWidth ? objectPart->length : uint32_t{timestampWidth};
    fprintf(out, "{\"number\":%u,\"node\":%u", data->entryNumber, data->entryNode);
    for (const letterField& field : letterFields) {
        putKey(out, field.key);
        putJsonText(out, &(data->*field.letter), 1);
    }
    putKey(out, "timestamp");
    putJsonText(out, objectPart->data, timestampLength);
    putKey(out, "sequence");
    putJsonText(out, objectPart->data + timestampLength, objectPart->length - timestampLength);
    for (const textField& field : textFields) {
        putKey(out, field.key);
        putBuffer(out, &(data->*field.text));
    }
    putKey(out, "logPosition");
    putc('"', out);
    for (uint8_t byte : data->logPosition)
        fprintf(out, "%02X", byte);
    putc('"', out);
    putKey(out, "tablespaces");
    putc('[', out);
    for (uint32_t i = 0; i < data->numTablespaces; i++) {
        fputs(i == 0 ? "" : ",", out);
        putBuffer(out, &data->tablespaceBuffers[i]);
    }
    putc(']', out);
    putKey(out, "sqlca");
    if (record->entry.sqlcaLength != 0)
        putSqlca(out, &record->event);
    else
        fputs("null", out);
    fputs("}\n", out);
}
