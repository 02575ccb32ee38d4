// The fields of an entry: what they are called in stanzas and in JSON, and where a record holds
// them. The stanza reader, the stanza writer and the JSON writer go by these tables.
#pragma once

#include "admin/record.h"

// A letter, and the words for some of its values, ended by a null word.
struct letterWord {
    const char* word;
    char letter;
};
struct letterField {
    const char* name;
    const char* key;
    char zq3HistoryData::*letter;
    const letterWord* words;
};

struct textField {
    const char* name;
    const char* key;
    textBuffer zq3HistoryData::*text;
    uint32_t SQLUH_ENTRY::*length; // the length that the entry states; null: none
    uint32_t limit;                // characters
    bool isWord;                   // no white space inside
};

// A member of the event's sqlca. count: characters, or numbers of 32 bits.
struct sqlcaField {
    const char* name;
    const char* key;
    size_t at;
    uint32_t count;
    bool isText;
};

enum : unsigned int { numLetterFields = 5, numTextFields = 9, numSqlcaFields = 8 };
extern const letterField letterFields[numLetterFields];
extern const textField textFields[numTextFields];
extern const sqlcaField sqlcaFields[numSqlcaFields]; // the SQLCODE first

// Fields that stand in no table.
#define FIELD_TIMESTAMP "Timestamp" // first 14 characters of objectPart
#define FIELD_SEQUENCE "Sequence"   // the rest of it
#define FIELD_TABLESPACE "Tablespace"
#define FIELD_NODE "Node"
#define FIELD_NUMBER "Number"
#define FIELD_LOG_POSITION "Log position"
#define FIELD_NOTE_LENGTH "Note length"
#define FIELD_LONG_TEXT_LENGTH "Long text length"
#define FIELD_TOKENS_LENGTH "SQLCA tokens length"
#define DEFAULT_SEQUENCE "001"

// The letter that a field left out stands for, given the operation. '-' is the absent letter.
char defaultLetter(const letterField* field, char operation);

// The word for a letter of the field; null when it has none.
const char* wordForLetter(const letterField* field, char letter);

// Whether a file holds the same for the field of two events.
bool isSameInFile(const sqlcaField* field, const sqlca* a, const sqlca* b);
