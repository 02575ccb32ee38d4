// The readable form of a history: stanzas of "Field: value" lines.
#pragma once

#include <cstdio>

#include "admin/record.h"

// What is wrong with a stanza text.
struct stanzaMistake {
    unsigned int line;  // counted from 1
    char found[64];     // the beginning of what was found; may hold any bytes
    size_t foundLength; // bytes in it
    char expected[192];
};

// Reads all entries of a text of any bytes and appends them to the list, complete but for the
// numbers that are left to their place. node: of entries that name none. Returns 0; stanzaMistaken
// with *mistake filled; or sqloSystemError with ENOMEM. After a failure the list may hold entries.
enum : int { stanzaMistaken = 1 };
int readStanzas(const char* text, size_t length, uint16_t node, historyList* list,
                stanzaMistake* mistake);

// Prints a record as a stanza, with an empty line after it. Reading it gives the record again.
void writeStanza(FILE* out, const historyRecord* record);
void writeUnnumbered(FILE* out, const historyRecord* record); // without its number

// Prints a record as one JSON object on one line.
void writeJson(FILE* out, const historyRecord* record);
