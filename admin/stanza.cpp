// Reading stanzas.
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

// Fields are numbered: those of the three tables, then the others.
enum : unsigned int {
    fieldOfLetters = 0,
    fieldOfTexts = fieldOfLetters + unsigned{numLetterFields},
    fieldOfSqlca = fieldOfTexts + unsigned{numTextFields},
    fieldTimestamp = fieldOfSqlca + unsigned{numSqlcaFields}, // the first of the others
    fieldSequence,
    fieldTablespace,
    fieldEntryNode,
    fieldEntryNumber,
    fieldPosition,
    fieldNoteLengthGiven,
    fieldLongTextLengthGiven,
    fieldTokensLengthGiven,
    numFields,
};
static_assert(numFields <= 32); // a bit for each says which were seen

struct stanzaReader {
    const char* at;
    const char* end;
    unsigned int line;
    uint16_t node;
    historyList* list;
    stanzaMistake* mistake;
    char* value; // the current line's, without escapes
    size_t valueLength;
    bool isPlain; // no escape was in it

    // The entry being read.
    historyRecord* record; // null between entries
    unsigned int firstLine;
    uint32_t seen; // a bit for each field
    char timestamp[timestampWidth + 1];
    char sequence[4];
    uint32_t noteLength, longTextLength, tokensLength;
};

static constexpr int noMemory = sqloSystemError | ENOMEM;

static bool isWhite(char c)
{
    return c == ' ' || (c >= '\t' && c <= '\r');
}

// --- Mistakes ------------------------------------------------------------------------------------

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

static int wrongValue(stanzaReader* reader, const char* expected)
{
    return mistakeAt(reader, reader->line, reader->value, reader->valueLength, "%s", expected);
}

// --- Values --------------------------------------------------------------------------------------

// Takes the escape at *at, behind its backslash. False when there is no such escape.
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
    reader->valueLength = 0;
    reader->isPlain = true;
    while (at != end) {
        const char* from = at;
        char c = *at++;
        if (c == '\\') {
            reader->isPlain = false;
            if (!takeEscape(&at, end, &c))
                return mistakeAt(reader, reader->line, from, static_cast<size_t>(end - from),
                                 "one of the escapes \\n, \\t, \\\\ and \\xHH");
        }
        reader->value[reader->valueLength++] = c;
    }
    return 0;
}

static int takeNumber(stanzaReader* reader, long long least, long long most, long long* number)
{
    char digits[24];
    char* behind = digits;
    errno = 0;
    if (reader->valueLength != 0 && reader->valueLength < sizeof digits) {
        memcpy(digits, reader->value, reader->valueLength);
        digits[reader->valueLength] = '\0';
        *number = strtoll(digits, &behind, 10);
    }
    if (behind == digits || behind != digits + reader->valueLength || errno != 0 ||
        *number < least || *number > most)
        return mistakeAt(reader, reader->line, reader->value, reader->valueLength,
                         "a number from %lld to %lld", least, most);
    return 0;
}

static int takeUnsigned(stanzaReader* reader, uint32_t* number)
{
    long long value = 0;
    int rc = takeNumber(reader, 0, UINT32_MAX, &value);
    *number = static_cast<uint32_t>(value);
    return rc;
}

// A text must be one that the entry's terminated strings can hold; a word must be one for whoever
// reads it back.
static int checkText(stanzaReader* reader, uint32_t limit, bool isWord)
{
    if (reader->valueLength > limit)
        return mistakeAt(reader, reader->line, reader->value, reader->valueLength,
                         "at most %u characters", limit);
    for (size_t i = 0; i < reader->valueLength; i++) {
        if (reader->value[i] == '\0')
            return wrongValue(reader, "a text without zero bytes");
        if (isWord && isWhite(reader->value[i]))
            return wrongValue(reader, "one word without white space");
    }
    return 0;
}

// --- Fields --------------------------------------------------------------------------------------

static int takeLetterField(stanzaReader* reader, const letterField* field)
{
    char known[96] = "";
    char* letter = &(reader->record->data.*field->letter);
    *letter = reader->valueLength == 1 ? reader->value[0] : '\0';
    for (const letterWord* word = field->words; word->word != nullptr; word++) {
        if (strlen(word->word) == reader->valueLength &&
            strncasecmp(word->word, reader->value, reader->valueLength) == 0)
            *letter = word->letter;
        snprintf(known + strlen(known), sizeof known - strlen(known), ", %s", word->word);
    }
    if (*letter == '\0')
        return mistakeAt(reader, reader->line, reader->value, reader->valueLength,
                         "one character%s", known);
    if (field->letter == &zq3HistoryData::operation && isWhite(*letter))
        return wrongValue(reader, "a character that is no white space");
    return 0;
}

static int takeTextField(stanzaReader* reader, const textField* field)
{
    int rc = checkText(reader, field->limit, field->isWord);
    bool isTimestamp = field->limit == timestampWidth && field->isWord;
    if (rc == 0 && isTimestamp && reader->isPlain && reader->valueLength != 0 &&
        (reader->valueLength != timestampWidth ||
         strspn(reader->value, "0123456789") < timestampWidth))
        return wrongValue(reader, "a timestamp of 14 digits");
    textBuffer* text = &(reader->record->data.*field->text);
    if (rc == 0 && !setText(text, reader->value, reader->valueLength))
        return noMemory;
    if (field->length != nullptr)
        reader->record->entry.*field->length = static_cast<uint32_t>(reader->valueLength);
    return rc;
}

static int takeDiagnostics(stanzaReader* reader, int32_t* numbers, uint32_t count)
{
    char text[96];
    char* at = text;
    size_t length = reader->valueLength < sizeof text ? reader->valueLength : 0;
    memcpy(text, reader->value, length);
    text[length] = '\0';
    for (uint32_t i = 0; i < count; i++) {
        char* behind = at;
        long long number = strtoll(at, &behind, 10);
        if (behind == at || number < INT32_MIN || number > INT32_MAX)
            return mistakeAt(reader, reader->line, reader->value, reader->valueLength,
                             "%u numbers of 32 bits", count);
        numbers[i] = static_cast<int32_t>(number);
        at = behind;
    }
    return *at == '\0' ? 0 : wrongValue(reader, "nothing behind the last number");
}

static int takeSqlcaField(stanzaReader* reader, const sqlcaField* field)
{
    char* member = reinterpret_cast<char*>(&reader->record->event) + field->at;
    reader->record->entry.sqlcaLength = sqlcaLineLength;
    if (!field->isText && field->count > 1)
        return takeDiagnostics(reader, reinterpret_cast<int32_t*>(member), field->count);
    if (!field->isText) {
        long long number = 0;
        bool isLength = field->at == offsetof(sqlca, sqlcabc);
        int rc = takeNumber(reader, isLength ? 0 : INT32_MIN, INT32_MAX, &number);
        int32_t value = static_cast<int32_t>(number);
        memcpy(member, &value, sizeof value);
        return rc;
    }
    bool rawBytes = field->at == offsetof(sqlca, sqlwarn);
    if (reader->valueLength > field->count || !rawBytes) {
        int rc = checkText(reader, field->count, false);
        if (rc != 0)
            return rc;
    }
    memset(member, ' ', field->count);
    memcpy(member, reader->value, reader->valueLength);
    if (field->at == offsetof(sqlca, sqlerrmc))
        reader->record->event.sqlerrml = static_cast<int16_t>(reader->valueLength);
    return 0;
}

static int takeTimestamp(stanzaReader* reader)
{
    int rc = checkText(reader, timestampWidth, true);
    if (rc == 0 && reader->isPlain &&
        (reader->valueLength != timestampWidth ||
         strspn(reader->value, "0123456789") < timestampWidth))
        return wrongValue(reader, "a timestamp of 14 digits");
    if (rc == 0)
        memcpy(reader->timestamp, reader->value, reader->valueLength);
    return rc;
}

static int takeSequence(stanzaReader* reader)
{
    int rc = checkText(reader, sizeof reader->sequence - 1, true);
    memset(reader->sequence, 0, sizeof reader->sequence);
    if (rc == 0)
        memcpy(reader->sequence, reader->value, reader->valueLength);
    return rc;
}

static int takeTablespace(stanzaReader* reader)
{
    int rc = checkText(reader, INT32_MAX, false);
    if (rc == 0 && !addTablespace(reader->record, reader->value, reader->valueLength))
        rc = noMemory;
    return rc;
}

static int takeNode(stanzaReader* reader)
{
    long long node = 0;
    int rc = takeNumber(reader, 0, UINT16_MAX, &node);
    reader->record->data.entryNode = static_cast<uint16_t>(node);
    return rc;
}

static int takeEntryNumber(stanzaReader* reader)
{
    reader->record->numberByPlace = false;
    return takeUnsigned(reader, &reader->record->data.entryNumber);
}

static int takeLogPosition(stanzaReader* reader)
{
    uint8_t* position = reader->record->data.logPosition;
    bool valid = reader->valueLength == entryFields[fieldLogPosition].width;
    for (size_t i = 0; valid && i < reader->valueLength; i += 2) {
        uint32_t byte = 0;
        valid = hexDigitsAt(reader->value + i, 2, &byte);
        position[i / 2] = static_cast<uint8_t>(byte);
    }
    return valid ? 0 : wrongValue(reader, "12 hexadecimal digits");
}

static int takeNoteLength(stanzaReader* reader)
{
    return takeUnsigned(reader, &reader->noteLength);
}

static int takeLongTextLength(stanzaReader* reader)
{
    return takeUnsigned(reader, &reader->longTextLength);
}

static int takeTokensLength(stanzaReader* reader)
{
    long long length = 0;
    int rc = takeNumber(reader, INT16_MIN, INT16_MAX, &length);
    reader->tokensLength = static_cast<uint16_t>(length);
    return rc;
}

struct otherField {
    const char* name;
    int (*take)(stanzaReader* reader);
};
static constexpr otherField otherFields[numFields - fieldTimestamp] = {
    {FIELD_TIMESTAMP, takeTimestamp},        {FIELD_SEQUENCE, takeSequence},
    {FIELD_TABLESPACE, takeTablespace},      {FIELD_NODE, takeNode},
    {FIELD_NUMBER, takeEntryNumber},         {FIELD_LOG_POSITION, takeLogPosition},
    {FIELD_NOTE_LENGTH, takeNoteLength},     {FIELD_LONG_TEXT_LENGTH, takeLongTextLength},
    {FIELD_TOKENS_LENGTH, takeTokensLength},
};

static const char* fieldName(unsigned int field)
{
    return field < fieldOfTexts     ? letterFields[field].name
           : field < fieldOfSqlca   ? textFields[field - fieldOfTexts].name
           : field < fieldTimestamp ? sqlcaFields[field - fieldOfSqlca].name
                                    : otherFields[field - fieldTimestamp].name;
}

static int takeField(stanzaReader* reader, unsigned int field)
{
    return field < fieldOfTexts     ? takeLetterField(reader, &letterFields[field])
           : field < fieldOfSqlca   ? takeTextField(reader, &textFields[field - fieldOfTexts])
           : field < fieldTimestamp ? takeSqlcaField(reader, &sqlcaFields[field - fieldOfSqlca])
                                    : otherFields[field - fieldTimestamp].take(reader);
}

static bool isSeen(const stanzaReader* reader, unsigned int field)
{
    return (reader->seen >> field & 1) != 0;
}

// --- Entries -------------------------------------------------------------------------------------

static int beginEntry(stanzaReader* reader)
{
    reader->record = newRecord();
    if (reader->record == nullptr)
        return noMemory;
    reader->record->numberByPlace = true;
    reader->record->data.entryNode = reader->node;
    reader->firstLine = reader->line;
    reader->seen = 0;
    memset(reader->timestamp, 0, sizeof reader->timestamp);
    memcpy(reader->sequence, DEFAULT_SEQUENCE, sizeof DEFAULT_SEQUENCE);
    return 0;
}

// An image's timestamp and its sequence number are one text.
static int joinObjectPart(stanzaReader* reader)
{
    char objectPart[timestampWidth + sizeof reader->sequence];
    if (reader->timestamp[0] == '\0')
        return 0;
    snprintf(objectPart, sizeof objectPart, "%s%s", reader->timestamp, reader->sequence);
    return setText(&reader->record->data.objectPart, objectPart, strlen(objectPart)) ? 0 : noMemory;
}

// A length that is given overrides that of the text.
static int settleLengths(stanzaReader* reader)
{
    SQLUH_ENTRY* entry = &reader->record->entry;
    if (isSeen(reader, fieldNoteLengthGiven))
        entry->noteLength = reader->noteLength;
    else if (entry->noteLength > maxNoteLength)
        return mistakeAt(reader, reader->firstLine, reader->record->data.noteText.data,
                         entry->noteLength, "a note of at most %u characters", maxNoteLength);
    if (isSeen(reader, fieldLongTextLengthGiven))
        entry->longTextLength = reader->longTextLength;
    if (isSeen(reader, fieldTokensLengthGiven))
        reader->record->event.sqlerrml = static_cast<int16_t>(reader->tokensLength);
    return 0;
}

static int endEntry(stanzaReader* reader)
{
    if (reader->record == nullptr)
        return 0;
    zq3HistoryData* data = &reader->record->data;
    if (!isSeen(reader, 0))
        return mistakeAt(reader, reader->firstLine, "", 0, "an Operation in the entry begun here");
    for (unsigned int i = 1; i < numLetterFields; i++)
        if (!isSeen(reader, i))
            data->*letterFields[i].letter = defaultLetter(&letterFields[i], data->operation);
    int rc = joinObjectPart(reader);
    if (rc == 0)
        rc = settleLengths(reader);
    if (rc == 0 && !addRecord(reader->list, reader->record))
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
    unsigned int field = 0;
    while (field < numFields && (strlen(fieldName(field)) != nameLength ||
                                 strncasecmp(fieldName(field), from, nameLength) != 0))
        field++;
    if (field == numFields)
        return mistakeAt(reader, reader->line, from, nameLength,
                         "a field such as Operation, Timestamp or Tablespace");

    int rc = reader->record == nullptr ? beginEntry(reader) : 0;
    if (rc == 0 && isSeen(reader, field) && field != fieldTablespace)
        return mistakeAt(reader, reader->line, from, nameLength,
                         "each field but Tablespace once in an entry");
    reader->seen |= uint32_t{1} << field;
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
    // No value is longer than the text; the terminator is for the functions that want one.
    char* value = static_cast<char*>(calloc(length + 1, 1));
    reader.value = value;
    int rc = value == nullptr ? noMemory : takeLines(&reader);
    freeRecord(reader.record);
    free(value);
    return rc;
}
