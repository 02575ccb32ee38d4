#include "admin/fields.h"

#include <cstring>

static constexpr letterWord operations[] = {{"backup", 'B'},
                                            {"restore", 'R'},
                                            {"create tablespace", 'A'},
                                            {"rename tablespace", 'N'},
                                            {nullptr, 0}};
static constexpr letterWord objects[] = {{"database", 'D'}, {"tablespace", 'P'}, {nullptr, 0}};
static constexpr letterWord types[] = {
    {"full", 'F'}, {"incremental", 'I'}, {"delta", 'D'}, {nullptr, 0}};
static constexpr letterWord states[] = {{"active", 'A'}, {"inactive", 'I'}, {nullptr, 0}};
static constexpr letterWord none[] = {{nullptr, 0}};

// The operation stands first: the defaults of the others follow from it.
const letterField letterFields[numLetterFields] = {
    {"Operation", "operation", &zq3HistoryData::operation, operations},
    {"Object", "object", &zq3HistoryData::object, objects},
    {"Type", "type", &zq3HistoryData::operationType, types},
    {"Status", "status", &zq3HistoryData::status, states},
    {"Aux code", "auxCode", &zq3HistoryData::auxCode, none},
};

const textField textFields[numTextFields] = {
    {"Second timestamp", "secondTimestamp", &zq3HistoryData::secondTimestamp, nullptr,
     entryFields[fieldSecondTimestamp].width, true},
    {"First text", "firstText", &zq3HistoryData::firstText, nullptr,
     entryFields[fieldFirstText].width, true},
    {"Last text", "lastText", &zq3HistoryData::lastText, nullptr, entryFields[fieldLastText].width,
     true},
    {"Id", "id", &zq3HistoryData::idText, nullptr, entryFields[fieldIdText].width, true},
    {"Qualifier", "qualifier", &zq3HistoryData::qualifierText, &SQLUH_ENTRY::qualifierLength,
     INT32_MAX, false},
    {"Name", "name", &zq3HistoryData::nameText, &SQLUH_ENTRY::nameLength, INT32_MAX, false},
    {"Long text", "longText", &zq3HistoryData::longText, &SQLUH_ENTRY::longTextLength,
     maxLongTextLength, false},
    {"Note", "note", &zq3HistoryData::noteText, &SQLUH_ENTRY::noteLength, lineTextLength, false},
    {"Command", "command", &zq3HistoryData::commandText, &SQLUH_ENTRY::commandLength, INT32_MAX,
     false},
};

const sqlcaField sqlcaFields[numSqlcaFields] = {
    {"SQLCODE", "sqlcode", offsetof(sqlca, sqlcode), 1, false},
    {"SQLSTATE", "sqlstate", offsetof(sqlca, sqlstate), sizeof sqlca::sqlstate, true},
    {"SQLCA id", "id", offsetof(sqlca, sqlcaid), sizeof sqlca::sqlcaid, true},
    {"SQLCA length", "length", offsetof(sqlca, sqlcabc), 1, false},
    {"SQLCA tokens", "tokens", offsetof(sqlca, sqlerrmc), sizeof sqlca::sqlerrmc, true},
    {"SQLCA product", "product", offsetof(sqlca, sqlerrp), sizeof sqlca::sqlerrp, true},
    {"SQLCA diagnostics", "diagnostics", offsetof(sqlca, sqlerrd), 6, false},
    {"SQLCA warnings", "warnings", offsetof(sqlca, sqlwarn), sizeof sqlca::sqlwarn, true},
};

char defaultLetter(const letterField* field, char operation)
{
    if (field->letter == &zq3HistoryData::status)
        return 'A';
    if (field->letter == &zq3HistoryData::object)
        return operation == 'A' || operation == 'N' ? 'P' : 'D';
    if (field->letter == &zq3HistoryData::operationType && operation == 'B')
        return 'F';
    return SQLUH_EMPTY_WORD[0];
}

const char* wordForLetter(const letterField* field, char letter)
{
    for (const letterWord* known = field->words; known->word != nullptr; known++)
        if (known->letter == letter)
            return known->word;
    return nullptr;
}

// An empty text is written as "-", and comes back so.
static bool isEmptyText(const char* text, uint32_t length)
{
    if (text[0] == SQLUH_EMPTY_WORD[0])
        text++, length--;
    for (uint32_t i = 0; i < length; i++)
        if (text[i] != ' ' && text[i] != '\0')
            return false;
    return true;
}

bool isSameInFile(const sqlcaField* field, const sqlca* a, const sqlca* b)
{
    const char* first = reinterpret_cast<const char*>(a) + field->at;
    const char* second = reinterpret_cast<const char*>(b) + field->at;
    size_t length = field->isText ? field->count : field->count * sizeof(int32_t);
    if (memcmp(first, second, length) == 0)
        return true;
    bool mayBeDash = field->at == offsetof(sqlca, sqlerrmc) ||
                     field->at == offsetof(sqlca, sqlerrp) ||
                     field->at == offsetof(sqlca, sqlstate);
    return mayBeDash && isEmptyText(first, field->count) && isEmptyText(second, field->count);
}
