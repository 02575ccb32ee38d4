// The fields of an entry: a row for each says what it is called in stanzas and in JSON, where a
// record holds it in which form, how a value is taken, and what leaving it out stands for. The
// reader and both writers go by the rows.
#pragma once

#include "admin/json.h"
#include "admin/record.h"

// A value of a stanza, and what its field wants where it refuses it.
struct fieldValue {
    const char* text; // without escapes, terminated; may hold any bytes
    size_t length;
    bool isPlain; // no escape was in it
    char expected[192];
};
enum : int { valueRefused = 1 };

// How a record holds a field.
enum fieldForm : uint8_t {
    formLetter,
    formBuffer,  // a textBuffer
    formString,  // characters and a terminator
    formColumns, // characters, blanks after them
    formNumbers,
    formBytes, // shown as hexadecimal digits
    formNames, // of tablespaces
};

// What a text must be beyond one without zero bytes.
// A word that is an image's timestamp if it has 14 digits: oneImage.
enum textRule : uint8_t { anyText, oneWord, oneTimestamp, oneImage, shortName, anyBytes };

struct letterWord {
    const char* word;
    char letter;
};

struct recordField {
    const char* name;
    const char* key; // null: not in JSON
    fieldForm form;
    textRule rule;
    uint16_t count;        // of the numbers
    uint32_t size;         // most characters or bytes of the member; bytes of each number
    size_t at;             // of the member in historyRecord
    long long least, most; // of a number
    // Takes a value into the record. Returns 0; valueRefused with value->expected filled; or
    // sqloSystemError with ENOMEM.
    int (*take)(const recordField* field, historyRecord* record, fieldValue* value);
    // Sets the member to what it is when a stanza leaves the field out, with the codes of take;
    // null: a stanza always has it, or a record begins so.
    int (*settle)(const recordField* field, historyRecord* record, fieldValue* value);
    const letterWord* words;       // for values of a letter, ended by a null word
    uint32_t SQLUH_ENTRY::*length; // that the entry states for a text; null: none
};

// The operation stands first: what others stand for when left out follows from it. The members of
// the sqlca stand last.
enum : unsigned int { numRecordFields = 31 };
extern const recordField recordFields[numRecordFields];

bool isWhite(char c); // in the "C" locale
bool isInSqlca(const recordField* field);

// Prints the line of a stanza, unless leaving it out says the same.
void putField(const recordField* field, const historyRecord* record, FILE* out);

// Puts the member of an object.
void putJsonField(const recordField* field, const historyRecord* record, jsonWriter* json);
