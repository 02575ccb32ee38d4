// Taking the fixed part of an entry apart: by column, or with the scanning format.

#include "history/sqluhfix.h"

#include <cstdio>
#include <cstring>

#include "history/sqluhcol.h"
#include "history/sqluhist.h"

static bool canonicalNumber(const char* text, unsigned int field, uint32_t* value)
{
    return hexColumns(text + entryFields[field].at, value);
}

template <uint32_t size>
static bool canonicalWord(const char* text, unsigned int field, char (&word)[size])
{
    const char* from = text + entryFields[field].at;
    uint32_t length = wordLength<size - 1>(from);
    memcpy(word, from, size - 1);
    word[length] = '\0';
    return length != 0;
}

// What stands between the fields of a canonical fixed part: colons, the blanks that end line 1, its
// line feed. What is behind field 23 is not looked at, here or by the scanning format.
struct entryFrame {
    char mask[entryFixedLength]; // 0xFF where text counts
    char text[entryFixedLength];
};

static constexpr entryFrame makeEntryFrame(void)
{
    entryFrame frame = {};
    for (const sqluhField& field : entryFields)
        frame.text[field.at + field.width] = ':';
    for (uint32_t i = 0; i < entryReserved1Length; i++)
        frame.text[entryReserved1At + i] = ' ';
    frame.text[lineLength - 1] = '\n';
    for (uint32_t i = 0; i < entryFixedLength; i++)
        frame.mask[i] = frame.text[i] != '\0' ? '\xFF' : '\0';
    return frame;
}
static constexpr entryFrame canonicalFrame = makeEntryFrame();

static bool hasCanonicalFrame(const char* text)
{
    unsigned char different = 0;
    for (uint32_t i = 0; i < entryFixedLength; i++)
        different |=
            static_cast<unsigned char>((text[i] ^ canonicalFrame.text[i]) & canonicalFrame.mask[i]);
    char operation = text[entryFields[fieldOperation].at];
    return different == 0 && operation > 0x20 && operation < 0x7F;
}

bool sqluhTakeCanonicalFixedPart(const char* text, sqluhFixedPart* fixed)
{
    if (!hasCanonicalFrame(text))
        return false;
    uint32_t node = 0;
    bool canonical = canonicalNumber(text, fieldChecksum, &fixed->checksum) &&
                     hexDigitsAt(text + entryFields[fieldNode].at, 4, &node) &&
                     canonicalNumber(text, fieldNumber, &fixed->entryNumber) &&
                     canonicalNumber(text, fieldSize, &fixed->size) &&
                     decimalColumns(text + entryFields[fieldVersion].at, &fixed->version) &&
                     canonicalNumber(text, fieldNoteLength, &fixed->noteLength) &&
                     canonicalNumber(text, fieldLongTextLength, &fixed->longTextLength) &&
                     canonicalNumber(text, fieldQualifierLength, &fixed->qualifierLength) &&
                     canonicalNumber(text, fieldNameLength, &fixed->nameLength) &&
                     canonicalNumber(text, fieldNumTablespaces, &fixed->numTablespaces) &&
                     canonicalNumber(text, fieldSqlcaLength, &fixed->sqlcaLength) &&
                     canonicalNumber(text, fieldCommandLength, &fixed->commandLength) &&
                     canonicalWord(text, fieldObjectPart, fixed->objectPart) &&
                     canonicalWord(text, fieldSecondTimestamp, fixed->secondTimestamp) &&
                     canonicalWord(text, fieldFirstText, fixed->firstText) &&
                     canonicalWord(text, fieldLastText, fixed->lastText) &&
                     canonicalWord(text, fieldLogPosition, fixed->logPosition) &&
                     canonicalWord(text, fieldIdText, fixed->idText);
    fixed->entryNode = static_cast<uint16_t>(node);
    fixed->status = text[entryFields[fieldStatus].at];
    fixed->operation = text[entryFields[fieldOperation].at];
    fixed->object = text[entryFields[fieldObject].at];
    fixed->operationType = text[entryFields[fieldOperationType].at];
    fixed->auxCode = text[entryFields[fieldAuxCode].at];
    // A zero byte ends the text for the scanning format.
    return canonical && fixed->status != '\0' && fixed->object != '\0' &&
           fixed->operationType != '\0' && fixed->auxCode != '\0';
}

int sqluhScanFixedPart(const char* text, sqluhFixedPart* fixed)
{
    char line[entryFixedLength + 1];
    memcpy(line, text, entryFixedLength);
    line[entryFixedLength] = '\0';
    memset(fixed->objectPart, 0, sizeof fixed->objectPart);
    memset(fixed->secondTimestamp, 0, sizeof fixed->secondTimestamp);
    memset(fixed->firstText, 0, sizeof fixed->firstText);
    memset(fixed->lastText, 0, sizeof fixed->lastText);
    memset(fixed->logPosition, 0, sizeof fixed->logPosition);
    memset(fixed->idText, 0, sizeof fixed->idText);
    int found = sscanf(
        line, entryScanFormat, &fixed->checksum, &fixed->entryNode, &fixed->entryNumber,
        &fixed->size, &fixed->version, &fixed->status, &fixed->noteLength, &fixed->longTextLength,
        &fixed->qualifierLength, &fixed->nameLength, &fixed->numTablespaces, &fixed->sqlcaLength,
        &fixed->commandLength, &fixed->operation, &fixed->object, &fixed->operationType,
        fixed->objectPart, fixed->secondTimestamp, fixed->firstText, fixed->lastText,
        fixed->logPosition, fixed->idText, &fixed->auxCode);
    return found < 0 ? 0 : found;
}
