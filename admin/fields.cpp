#include "admin/fields.h"

#include <cerrno>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <strings.h>

#include "admin/zq3hist.h"
#include "history/sqluhColumns.h"

#define DEFAULT_SEQUENCE "001"

static constexpr letterWord operationWords[] = {{"backup", zq3OperationBackup},
                                                {"restore", zq3OperationRestore},
                                                {"create tablespace", zq3OperationCreate},
                                                {"rename tablespace", zq3OperationRename},
                                                {nullptr, 0}};
static constexpr letterWord objectWords[] = {
    {"database", zq3ObjectDatabase}, {"tablespace", zq3ObjectTablespace}, {nullptr, 0}};
static constexpr letterWord typeWords[] = {
    {"full", 'F'}, {"incremental", 'I'}, {"delta", 'D'}, {nullptr, 0}};
static constexpr letterWord statusWords[] = {
    {"active", zq3StatusActive}, {"inactive", zq3StatusInactive}, {nullptr, 0}};
static constexpr letterWord noWords[] = {{nullptr, SQLUH_EMPTY_WORD[0]}};

static char* memberOf(const recordField* field, historyRecord* record)
{
    return reinterpret_cast<char*>(record) + field->at;
}

static const char* memberOf(const recordField* field, const historyRecord* record)
{
    return reinterpret_cast<const char*>(record) + field->at;
}

bool isInSqlca(const recordField* field)
{
    return field->at >= offsetof(historyRecord, event) &&
           field->at < offsetof(historyRecord, event) + sizeof(sqlca);
}

// --- Taking --------------------------------------------------------------------------------------

static int refuse(fieldValue* value, const char* format, ...) __attribute__((format(printf, 2, 3)));
static int refuse(fieldValue* value, const char* format, ...)
{
    va_list arguments;
    va_start(arguments, format);
    vsnprintf(value->expected, sizeof value->expected, format, arguments);
    va_end(arguments);
    return valueRefused;
}

bool isWhite(char c)
{
    return c == ' ' || (c >= '\t' && c <= '\r');
}

static bool isDigits(const char* text, size_t length)
{
    return length == timestampWidth && strspn(text, "0123456789") >= timestampWidth;
}

// Whether a value would be refused if it had no escape; with one any can be given, since a history
// may hold it.
static bool isOdd(const recordField* field, const char* text, size_t length)
{
    bool areDigits = isDigits(text, length);
    bool isTimestamp = areDigits && isTime(text);
    return (field->rule == oneTimestamp && !isTimestamp) ||
           (field->rule == oneImage && areDigits && !isTimestamp) ||
           (field->rule == shortName && length >= zq3TablespaceNameCapacity);
}

// A text must be one that the entry's terminated strings can hold; a word must be one for whoever
// reads it back.
static int checkText(const recordField* field, fieldValue* value)
{
    if (value->length > field->size)
        return refuse(value, "at most %u characters", field->size);
    for (size_t i = 0; field->rule != anyBytes && i < value->length; i++) {
        if (value->text[i] == '\0')
            return refuse(value, "a text without zero bytes");
        bool isWord =
            field->rule == oneWord || field->rule == oneTimestamp || field->rule == oneImage;
        if (isWord && isWhite(value->text[i]))
            return refuse(value, "one word without white space");
    }
    bool isLeftEmpty = field->form == formBuffer && value->length == 0;
    if (!value->isPlain || isLeftEmpty || !isOdd(field, value->text, value->length))
        return 0;
    return field->rule == shortName
               ? refuse(value, "a name of at most %u characters", zq3TablespaceNameCapacity - 1)
           : isDigits(value->text, value->length) ? refuse(value, "a date and a time that exist")
                                                  : refuse(value, "a timestamp of 14 digits");
}

static int takeTextValue(const recordField* field, historyRecord* record, fieldValue* value)
{
    char* member = memberOf(field, record);
    bool stored = true;
    int rc = checkText(field, value);
    if (rc != 0)
        return rc;
    if (field->form == formBuffer)
        stored = setText(reinterpret_cast<textBuffer*>(member), value->text, value->length);
    else if (field->form == formNames)
        stored = addTablespace(record, value->text, value->length);
    else if (field->form == formColumns)
        memcpy(memset(member, ' ', field->size), value->text, value->length);
    else
        memcpy(member, value->text, value->length + 1);
    if (field->length != nullptr)
        record->entry.*field->length = static_cast<uint32_t>(value->length);
    return stored ? 0 : sqloSystemError | ENOMEM;
}

static int takeLetter(const recordField* field, historyRecord* record, fieldValue* value)
{
    char known[96] = "";
    char letter = value->length == 1 ? value->text[0] : '\0';
    for (const letterWord* word = field->words; word->word != nullptr; word++) {
        if (strlen(word->word) == value->length &&
            strncasecmp(word->word, value->text, value->length) == 0)
            letter = word->letter;
        snprintf(known + strlen(known), sizeof known - strlen(known), ", %s", word->word);
    }
    *memberOf(field, record) = letter;
    if (letter == '\0')
        return refuse(value, "one character%s", known);
    return field->rule == oneWord && isWhite(letter)
               ? refuse(value, "a character that is no white space")
               : 0;
}

static int takeNumbers(const recordField* field, historyRecord* record, fieldValue* value)
{
    const char* at = value->text;
    char* member = memberOf(field, record);
    bool valid = true;
    for (uint32_t i = 0; valid && i < field->count; i++) {
        char* after = nullptr;
        errno = 0;
        long long number = strtoll(at, &after, 10);
        valid = after != at && errno == 0 && number >= field->least && number <= field->most;
        uint32_t bits = static_cast<uint32_t>(number);
        memcpy(member + size_t{i} * field->size, &bits, field->size); // the low bytes stand first
        at = after;
    }
    if (valid && at == value->text + value->length)
        return 0;
    return field->count == 1
               ? refuse(value, "a number from %lld to %lld", field->least, field->most)
               : refuse(value, "%u numbers of 32 bits", field->count);
}

static int takeEntryNumber(const recordField* field, historyRecord* record, fieldValue* value)
{
    record->numberByPlace = false;
    return takeNumbers(field, record, value);
}

static int takeBytes(const recordField* field, historyRecord* record, fieldValue* value)
{
    bool valid = value->length == 2 * field->size;
    for (size_t i = 0; valid && i < field->size; i++) {
        uint32_t byte = 0;
        valid = hexDigitsAt(value->text + 2 * i, 2, &byte);
        memberOf(field, record)[i] = static_cast<char>(byte);
    }
    return valid ? 0 : refuse(value, "%u hexadecimal digits", 2 * field->size);
}

// --- What fields stand for when they are left out ------------------------------------------------

static int refuseAbsence(const recordField*, historyRecord*, fieldValue* value)
{
    return refuse(value, "an Operation in the entry begun here");
}

static int settleLetter(const recordField* field, historyRecord* record, fieldValue*)
{
    *memberOf(field, record) = field->words[0].letter;
    return 0;
}

static int settleObject(const recordField* field, historyRecord* record, fieldValue*)
{
    char operation = record->data.operation;
    bool ofTablespace = operation == zq3OperationCreate || operation == zq3OperationRename;
    *memberOf(field, record) = field->words[ofTablespace].letter;
    return 0;
}

static int settleType(const recordField* field, historyRecord* record, fieldValue*)
{
    bool isBackup = record->data.operation == zq3OperationBackup;
    *memberOf(field, record) = isBackup ? field->words[0].letter : SQLUH_EMPTY_WORD[0];
    return 0;
}

static int settleEmpty(const recordField* field, historyRecord* record, fieldValue*)
{
    if (field->form == formBuffer)
        reinterpret_cast<textBuffer*>(memberOf(field, record))->length = 0;
    else
        memset(memberOf(field, record), 0, field->form == formString ? 1 : field->size);
    return 0;
}

static int settleSequence(const recordField*, historyRecord* record, fieldValue*)
{
    snprintf(record->sequence, sizeof record->sequence, "%s",
             record->timestamp[0] == '\0' ? "" : DEFAULT_SEQUENCE);
    return 0;
}

// The lengths that an entry states may differ from those of its texts.
static int settleNoteLength(const recordField*, historyRecord* record, fieldValue* value)
{
    const textBuffer* note = &record->data.noteText;
    record->entry.noteLength = note->length;
    if (note->length <= maxNoteLength)
        return 0;
    value->text = note->data;
    value->length = note->length;
    return refuse(value, "a note of at most %u characters", maxNoteLength);
}

static int settleLongTextLength(const recordField*, historyRecord* record, fieldValue*)
{
    record->entry.longTextLength = record->data.longText.length;
    return 0;
}

static size_t lengthWithoutBlanks(const char* text, size_t length)
{
    while (length > 0 && text[length - 1] == ' ')
        length--;
    return length;
}

// A file holds "-" for an empty text, and readers get that.
static bool isEmptyText(const char* text, size_t length)
{
    if (text[0] == SQLUH_EMPTY_WORD[0])
        text++, length--;
    for (size_t i = 0; i < length; i++)
        if (text[i] != ' ' && text[i] != '\0')
            return false;
    return true;
}

static int settleTokensLength(const recordField*, historyRecord* record, fieldValue*)
{
    sqlca* event = &record->event;
    size_t length = lengthWithoutBlanks(event->sqlerrmc, sizeof event->sqlerrmc);
    event->sqlerrml =
        isEmptyText(event->sqlerrmc, length) ? int16_t{0} : static_cast<int16_t>(length);
    return 0;
}

// Of the sqlca of an operation that has nothing to tell.
static int settleUsual(const recordField* field, historyRecord* record, fieldValue*)
{
    sqlca usual;
    sqloinca(&usual);
    const char* member =
        reinterpret_cast<const char*>(&usual) + (field->at - offsetof(historyRecord, event));
    bool mayBeDash = field->form == formColumns && field->rule == anyText;
    if (!mayBeDash || !isEmptyText(member, field->size) ||
        !isEmptyText(memberOf(field, record), field->size))
        memcpy(memberOf(field, record), member, size_t{field->size} * field->count);
    return 0;
}

// --- Putting -------------------------------------------------------------------------------------

// Whether leaving the field out gives the same.
static bool isImplied(const recordField* field, const historyRecord* record)
{
    historyRecord settled = *record; // shares the texts
    fieldValue value = {};
    if (field->settle == nullptr || field->settle(field, &settled, &value) != 0)
        return false;
    size_t length =
        field->form == formBuffer ? sizeof(textBuffer) : size_t{field->size} * field->count;
    return memcmp(memberOf(field, record), memberOf(field, &settled), length) == 0;
}

static long long numberIn(const recordField* field, const historyRecord* record, uint32_t index)
{
    const char* member = memberOf(field, record) + size_t{index} * field->size;
    bool isSigned = field->least < 0;
    uint32_t bits = 0;
    memcpy(&bits, member, field->size);
    if (field->size == sizeof(uint16_t))
        return isSigned ? static_cast<int16_t>(bits) : static_cast<long long>(bits);
    return isSigned ? static_cast<int32_t>(bits) : static_cast<long long>(bits);
}

// The text of a field that is one; digits has room for that of bytes.
static const char* textIn(const recordField* field, const historyRecord* record, char* digits,
                          size_t* length)
{
    const char* member = memberOf(field, record);
    const textBuffer* text = reinterpret_cast<const textBuffer*>(member);
    *length = field->form == formBuffer   ? text->length
              : field->form == formString ? strlen(member)
              : field->form == formBytes  ? 2 * size_t{field->size}
                                          : field->size;
    for (size_t i = 0; field->form == formBytes && i < field->size; i++)
        snprintf(digits + 2 * i, 3, "%02X", static_cast<unsigned char>(member[i]));
    return field->form == formBuffer ? text->data : field->form == formBytes ? digits : member;
}

// Escapes blanks at the ends, which would be lost, and the first character of an odd value.
static void putValue(const recordField* field, const char* text, size_t length, FILE* out)
{
    fprintf(out, "%s: ", field->name);
    if (length != 0 && (text[0] == ' ' || isOdd(field, text, length))) {
        fprintf(out, "\\x%02X", static_cast<unsigned char>(text[0]));
        text++, length--;
    }
    bool blankAtEnd = length != 0 && text[length - 1] == ' ';
    putEscaped(out, text, length - blankAtEnd);
    fputs(blankAtEnd ? "\\x20\n" : "\n", out);
}

static void putWord(const recordField* field, const char* letter, FILE* out)
{
    const letterWord* word = field->words;
    while (word->word != nullptr && word->letter != *letter)
        word++;
    if (word->word != nullptr)
        putValue(field, word->word, strlen(word->word), out);
    else
        putValue(field, letter, 1, out);
}

static void putStanzaNumbers(const recordField* field, const historyRecord* record, FILE* out)
{
    fprintf(out, "%s:", field->name);
    for (uint32_t i = 0; i < field->count; i++)
        fprintf(out, " %lld", numberIn(field, record, i));
    putc('\n', out);
}

static void putJsonNumbers(const recordField* field, const historyRecord* record, jsonWriter* json)
{
    bool isList = field->count > 1;
    if (isList)
        beginJson(json, field->key, '[');
    for (uint32_t i = 0; i < field->count; i++)
        putJsonNumber(json, isList ? nullptr : field->key, numberIn(field, record, i));
    if (isList)
        endJson(json, ']');
}

void putField(const recordField* field, const historyRecord* record, FILE* out)
{
    char digits[32];
    size_t length;
    if (isImplied(field, record))
        return;
    if (field->form == formLetter) {
        putWord(field, memberOf(field, record), out);
    } else if (field->form == formNumbers) {
        putStanzaNumbers(field, record, out);
    } else if (field->form == formNames) {
        for (uint32_t i = 0; i < record->data.numTablespaces; i++)
            putValue(field, record->data.tablespaceBuffers[i].data,
                     record->data.tablespaceBuffers[i].length, out);
    } else {
        const char* text = textIn(field, record, digits, &length);
        bool isPadded = field->form == formColumns;
        putValue(field, text, isPadded ? lengthWithoutBlanks(text, length) : length, out);
    }
}

void putJsonField(const recordField* field, const historyRecord* record, jsonWriter* json)
{
    char digits[32];
    size_t length;
    if (field->form == formNumbers) {
        putJsonNumbers(field, record, json);
    } else if (field->form == formNames) {
        beginJson(json, field->key, '[');
        for (uint32_t i = 0; i < record->data.numTablespaces; i++)
            putJsonBytes(json, nullptr, record->data.tablespaceBuffers[i].data,
                         record->data.tablespaceBuffers[i].length);
        endJson(json, ']');
    } else {
        const char* text = textIn(field, record, digits, &length);
        putJsonBytes(json, field->key, text, length);
    }
}

// --- The table -----------------------------------------------------------------------------------

#define LETTER(name, key, rule, member, settle, words)                                             \
    {                                                                                              \
        name, key, formLetter, rule, 1, 1, offsetof(historyRecord, data.member), 0, 0, takeLetter, \
            settle, words, nullptr                                                                 \
    }
#define TEXT(name, key, rule, member, size, length)                                                \
    {                                                                                              \
        name, key, formBuffer, rule, 1, size, offsetof(historyRecord, data.member), 0, 0,          \
            takeTextValue, settleEmpty, nullptr, length                                            \
    }
#define STRING(name, key, rule, member, settle)                                                    \
    {                                                                                              \
        name, key, formString, rule, 1, sizeof historyRecord::member - 1,                          \
            offsetof(historyRecord, member), 0, 0, takeTextValue, settle, nullptr, nullptr         \
    }
#define COLUMNS(name, key, rule, member)                                                           \
    {                                                                                              \
        name, key, formColumns, rule, 1, sizeof sqlca::member,                                     \
            offsetof(historyRecord, event.member), 0, 0, takeTextValue, settleUsual, nullptr,      \
            nullptr                                                                                \
    }
#define NUMBER(name, key, member, size, count, least, most, take, settle)                          \
    {                                                                                              \
        name, key, formNumbers, anyText, count, size, offsetof(historyRecord, member), least,      \
            most, take, settle, nullptr, nullptr                                                   \
    }
#define WIDTH(field) entryFields[field].width

const recordField recordFields[numRecordFields] = {
    LETTER("Operation", "operation", oneWord, operation, refuseAbsence, operationWords),
    LETTER("Object", "object", anyText, object, settleObject, objectWords),
    LETTER("Type", "type", anyText, operationType, settleType, typeWords),
    LETTER("Status", "status", anyText, status, settleLetter, statusWords),
    LETTER("Aux code", "auxCode", anyText, auxCode, settleLetter, noWords),
    STRING("Timestamp", "timestamp", oneTimestamp, timestamp, settleEmpty),
    STRING("Sequence", "sequence", oneWord, sequence, settleSequence),
    TEXT("Second timestamp", "secondTimestamp", oneTimestamp, secondTimestamp, timestampWidth,
         nullptr),
    TEXT("First text", "firstText", oneWord, firstText, WIDTH(fieldFirstText), nullptr),
    TEXT("Last text", "lastText", oneWord, lastText, WIDTH(fieldLastText), nullptr),
    TEXT("Id", "id", oneImage, idText, WIDTH(fieldIdText), nullptr),
    TEXT("Qualifier", "qualifier", anyText, qualifierText, INT32_MAX,
         &SQLUH_ENTRY::qualifierLength),
    TEXT("Name", "name", anyText, nameText, INT32_MAX, &SQLUH_ENTRY::nameLength),
    TEXT("Long text", "longText", anyText, longText, maxLongTextLength, nullptr),
    TEXT("Note", "note", anyText, noteText, lineTextLength, nullptr),
    TEXT("Command", "command", anyText, commandText, INT32_MAX, &SQLUH_ENTRY::commandLength),
    NUMBER("Note length", nullptr, entry.noteLength, 4, 1, 0, UINT32_MAX, takeNumbers,
           settleNoteLength),
    NUMBER("Long text length", nullptr, entry.longTextLength, 4, 1, 0, UINT32_MAX, takeNumbers,
           settleLongTextLength),
    {"Log position", "logPosition", formBytes, anyText, 1, sizeof zq3HistoryData::logPosition,
     offsetof(historyRecord, data.logPosition), 0, 0, takeBytes, settleEmpty, nullptr, nullptr},
    NUMBER("Node", "node", data.entryNode, 2, 1, 0, UINT16_MAX, takeNumbers, nullptr),
    NUMBER("Number", "number", data.entryNumber, 4, 1, 0, UINT32_MAX, takeEntryNumber, nullptr),
    {"Tablespace", "tablespaces", formNames, shortName, 1, INT32_MAX,
     offsetof(historyRecord, data.tablespaceBuffers), 0, 0, takeTextValue, nullptr, nullptr,
     nullptr},
    NUMBER("SQLCODE", "sqlcode", event.sqlcode, 4, 1, INT32_MIN, INT32_MAX, takeNumbers, nullptr),
    COLUMNS("SQLSTATE", "sqlstate", anyText, sqlstate),
    COLUMNS("SQLCA id", "id", anyText, sqlcaid),
    NUMBER("SQLCA length", "length", event.sqlcabc, 4, 1, 0, INT32_MAX, takeNumbers, settleUsual),
    COLUMNS("SQLCA tokens", "tokens", anyText, sqlerrmc),
    COLUMNS("SQLCA product", "product", anyText, sqlerrp),
    NUMBER("SQLCA diagnostics", "diagnostics", event.sqlerrd, 4, 6, INT32_MIN, INT32_MAX,
           takeNumbers, settleUsual),
    COLUMNS("SQLCA warnings", "warnings", anyBytes, sqlwarn),
    NUMBER("SQLCA tokens length", "tokensLength", event.sqlerrml, 2, 1, INT16_MIN, INT16_MAX,
           takeNumbers, settleTokensLength),
};
