// Taking the fixed part of an entry apart, by column or with the scanning format: both ways go by
// the table of fields and write into the members that it names. Stands on nothing in the library.

#include "history/sqluhFixedPart.h"

#include <cstdio>
#include <cstring>
#include <type_traits>
#include <utility>

#include "history/sqluhColumns.h"

// Tells whether the table, the printing and the scanning format give every field the same columns.
static constexpr bool formatsAgree(void)
{
    unsigned int printed = 0; // conversions, the reserved blanks among them
    for (unsigned int field = 0; field < entryFieldCount; field++) {
        if (placeInFormat(entryFormat, printed).width == entryReserved1Length)
            printed++;
        formatPlace place = placeInFormat(entryFormat, printed++);
        if (place.at != entryFields[field].at || place.width != entryFields[field].width ||
            placeInFormat(entryScanFormat, field).width != entryFields[field].width)
            return false;
    }
    return placeInFormat(entryFormat, printed + 1).at == entryFixedLength;
}
static_assert(formatsAgree());

static constexpr bool isNumber(sqluhFieldKind kind)
{
    return kind == kindHex || kind == kindHex16 || kind == kindDecimal;
}

static constexpr bool isLetter(sqluhFieldKind kind)
{
    return kind == kindLetter || kind == kindOptionalLetter;
}

// Where the value of a field goes: the member, or for a word its place in words.
template <unsigned int field>
static inline auto targetOf(SQLUH_ENTRY* entry, sqluhFixedWords* words)
{
    constexpr sqluhEntryField row = entryFields[field];
    char* owner = row.owner == ownerEntry ? reinterpret_cast<char*>(entry)
                                          : reinterpret_cast<char*>(entry->data);
    if constexpr (row.kind == kindHex16)
        return reinterpret_cast<uint16_t*>(owner + row.member);
    else if constexpr (isNumber(row.kind))
        return reinterpret_cast<uint32_t*>(owner + row.member);
    else if constexpr (isLetter(row.kind))
        return owner + row.member;
    else
        return static_cast<char*>(words->text[field - fieldObjectPart]);
}

// --- By column -----------------------------------------------------------------------------------

// The columns that neighbouring entries have most alike: from the version to the end of line 1.
enum : uint32_t { likelyAt = entryFields[fieldVersion].at, likelyLength = lineLength - likelyAt };
static constexpr bool isLikely(unsigned int field)
{
    return field >= fieldVersion && field <= fieldCommandLength;
}

// Takes a word; tells whether it stands as the writer writes it.
static inline bool takeWord(const char* from, uint32_t width, char* word)
{
    uint32_t length = wordLength(from, width);
    memcpy(word, from, width);
    word[length] = '\0';
    return length != 0;
}

// Takes a number aside, or a word, unless it is kept; tells whether the field stands as the writer
// writes it.
template <unsigned int field>
static inline bool takeColumn(const char* text, sqluhFixedPart* part, bool isKept, bool isLine1Kept)
{
    constexpr sqluhEntryField row = entryFields[field];
    const char* from = text + row.at;
    if (isLikely(field) && isLine1Kept)
        return true;
    if (from[row.width] != ':')
        return false;
    if constexpr (row.kind == kindHex)
        return hexColumns(from, &part->numbers[field]);
    else if constexpr (row.kind == kindHex16)
        return hexDigitsAt(from, row.width, &part->numbers[field]);
    else if constexpr (row.kind == kindDecimal)
        return decimalColumns(from, &part->numbers[field]);
    else if constexpr (isLetter(row.kind))
        return *from != '\0'; // which ends the text for the scanning format
    else
        return (isKept && memcmp(from, part->text + row.at, row.width) == 0) ||
               takeWord(from, row.width, part->words.text[field - fieldObjectPart]);
}

template <unsigned int field>
static inline void storeColumn(const char* text, const uint32_t* numbers, SQLUH_ENTRY* entry)
{
    constexpr sqluhEntryField row = entryFields[field];
    if constexpr (isNumber(row.kind)) {
        auto target = targetOf<field>(entry, nullptr);
        *target = static_cast<std::remove_pointer_t<decltype(target)>>(numbers[field]);
    } else if constexpr (isLetter(row.kind)) {
        *targetOf<field>(entry, nullptr) = text[row.at];
    }
}

// Whether line 1 ends as the writer ends it: with blanks, each like the one before it.
static bool isLine1Ended(const char* text)
{
    const char* reserved = text + entryReserved1At;
    return reserved[0] == ' ' && memcmp(reserved, reserved + 1, entryReserved1Length - 1) == 0 &&
           text[lineTextLength] == '\n';
}

// Whether line 2 begins as the writer begins it; its end is not looked at, here or by the scanning
// format.
static bool isLine2Begun(const char* text)
{
    char operation = text[entryFields[fieldOperation].at];
    return operation > ' ' && operation < 0x7F;
}

template <unsigned int... fields>
static bool takeCanonical(const char* text, SQLUH_ENTRY* entry, sqluhFixedPart* part,
                          std::integer_sequence<unsigned int, fields...>)
{
    bool isKept = part->isKept;
    bool isLine1Kept = isKept && memcmp(text + likelyAt, part->text + likelyAt, likelyLength) == 0;
    part->isKept = false;
    if (!(isLine1Kept || isLine1Ended(text)) || !isLine2Begun(text) ||
        !(takeColumn<fields>(text, part, isKept, isLine1Kept) && ...))
        return false;
    (storeColumn<fields>(text, part->numbers, entry), ...);
    if (part->forNeighbours)
        memcpy(part->text, text, entryFixedLength);
    part->isKept = part->forNeighbours;
    return true;
}

// --- With the scanning format --------------------------------------------------------------------

template <unsigned int... fields>
static int scanFixedPart(const char* text, SQLUH_ENTRY* entry, sqluhFixedWords* words,
                         std::integer_sequence<unsigned int, fields...>)
{
    char line[entryFixedLength + 1];
    memcpy(line, text, entryFixedLength);
    line[entryFixedLength] = '\0';
    *words = {};
    int found = sscanf(line, entryScanFormat, targetOf<fields>(entry, words)...);
    return found < 0 ? 0 : found;
}

int sqluhTakeFixedPart(const char* text, SQLUH_ENTRY* entry, sqluhFixedPart* part)
{
    using allFields = std::make_integer_sequence<unsigned int, entryFieldCount>;
    if (takeCanonical(text, entry, part, allFields()))
        return entryFieldCount;
    return scanFixedPart(text, entry, &part->words, allFields());
}
