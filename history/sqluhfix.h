// The fixed part of an entry, taken apart in either of two ways. Shared by the sources of the
// reader.
#pragma once

#include <cstdint>

// What the fixed part holds, as the scanning format gives it.
struct sqluhFixedPart {
    uint32_t checksum, entryNumber, size, version, noteLength, longTextLength, qualifierLength,
        nameLength, numTablespaces, sqlcaLength, commandLength;
    uint16_t entryNode;
    char status, operation, object, operationType, auxCode;
    char objectPart[18], secondTimestamp[15], firstText[13], lastText[13], logPosition[13],
        idText[25];
};

// Takes a fixed part apart by column when it stands exactly as the writer writes it. Returns false,
// and leaves *fixed in part, when it does not: the scanning format then decides.
bool sqluhTakeCanonicalFixedPart(const char* text, sqluhFixedPart* fixed);

// Takes a fixed part apart with the scanning format. Returns the number of fields found; those not
// found are left as they were, the words empty.
int sqluhScanFixedPart(const char* text, sqluhFixedPart* fixed);
