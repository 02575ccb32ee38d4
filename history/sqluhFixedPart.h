// The fixed part of an entry, taken apart. Shared by the sources of the reader.
#pragma once

#include "history/sqluhist.h"

// The texts of fields 17 to 22, each one word, terminated.
enum : unsigned int { fixedWordCount = fieldAuxCode - fieldObjectPart, fixedWordCapacity = 25 };
struct sqluhFixedWords {
    char text[fixedWordCount][fixedWordCapacity];
};
static constexpr const char* wordOfField(const sqluhFixedWords* words, unsigned int field)
{
    return words->text[field - fieldObjectPart];
}

// A fixed part as it was taken. Handed in again for the next entry, what has not changed is not
// taken apart again: most columns of neighbours are the same. Starts zero-filled, but for the
// texts.
struct sqluhFixedPart {
    bool isKept;        // text, numbers and words are those of the last fixed part, by column
    bool forNeighbours; // set by a caller who hands it in again
    sqluhFixedWords words;
    uint32_t numbers[entryFieldCount];
    char text[entryFixedLength];
};

// Takes the fixed part at text, of 512 characters, into the entry, its data and part->words: by
// column when it stands exactly as the writer writes it, else with the scanning format, which
// accepts more. Returns the number of fields found; members of those not found are as they were,
// their words empty.
int sqluhTakeFixedPart(const char* text, SQLUH_ENTRY* entry, sqluhFixedPart* part);
