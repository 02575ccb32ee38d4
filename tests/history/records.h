// Records put together by hand, from the format alone.
#pragma once

#include "support.h"

inline std::string hex8(size_t value)
{
    char digits[20];
    snprintf(digits, sizeof digits, "%08zX", value);
    return digits;
}

// Puts the checksum of the whole record over its first eight characters.
inline std::string stamped(std::string record)
{
    uint32_t sum = 0;
    record.replace(0, 8, "00000000");
    for (size_t i = 0; i < record.size(); i++)
        sum ^= uint32_t{static_cast<unsigned char>(record[i])} << 8 * (i % 4);
    return record.replace(0, 8, hex8(sum));
}

inline std::string padded(std::string text, size_t width)
{
    text.resize(width, ' ');
    return text;
}

inline std::string line(const std::string& text)
{
    return padded(text, 255) + "\n";
}

// An entry. numbers: fields 7 to 13; words: fields 14 to 23; sections: what follows the note.
inline std::string entryOf(const std::string& numbers, const std::string& words,
                           const std::string& note, const std::string& sections = "",
                           const std::string& nodeAndNumber = "002A:00000007")
{
    return stamped(line("00000000:" + nodeAndNumber + ":" + hex8(768 + sections.size()) +
                        ":09010300:A:" + numbers + ":") +
                   line(words + ":") + line(note) + sections);
}

// An entry whose fields are empty but for the letters and the start of an object part, with a
// command of this length and these tablespaces.
inline std::string commandEntry(size_t commandLength, const std::string& part = "00000101000000",
                                const std::vector<std::string>& tablespaces = {})
{
    std::string sections;
    for (const std::string& name : tablespaces)
        sections += hex8(name.size()) + ":" + name + "\n";
    for (size_t i = 1; i <= commandLength; i++)
        sections += i % 255 == 0 || i == commandLength ? "c\n" : "c";
    return entryOf("00000000:00000000:00000000:00000000:" + hex8(tablespaces.size()) +
                       ":00000000:" + hex8(commandLength),
                   "B:-:-:" + padded(part, 17) +
                       ":00000101000000:-           :-           :"
                       "000000000000:-                       :-",
                   "", sections);
}

// An entry with a section of each kind.
inline std::string fullEntry()
{
    const std::string zero = "+0000000000", numbers = zero + "-2147483648" + zero + zero + zero;
    return entryOf("0000001E:0000000B:00000007:00000002:00000003:000000C2:000001FF",
                   "B:-:-:20260102030405001:20260102030500:S0000001.LOG:S2.LOG-and-m:"
                   "001FABFF1009:20250102030405          :x",
                   "note",
                   line("/backup/one") + "SCHEMA1\nT1\n0000000B:CATALOGROOM\n00000000:\n" +
                       "00000003:TS3\nSQLCA   0000000136-0000001234001F" + padded("tokens", 70) +
                       "PRODUCT " + numbers + "+2147483647W x" + std::string(8, '\0') + "51024\n" +
                       std::string(255, 'c') + "\n" + std::string(255, 'd') + "\ne\n",
                   "BEEF:DEADBEEF");
}

// A header that begins with this text.
inline std::string headerOf(const std::string& text)
{
    return line(text) + line("") + line("") + line("");
}

// The header of a new file.
inline std::string newHeader()
{
    return headerOf("31997D7D:0000000000000000:0000000000000000:0000000000000000:00000000:00000000:"
                    "00000000:00000000:00000000:00000000:00000000:00000000: :09010300:00000001:"
                    "00000101000000:00000000:");
}

// Log records as one text.
inline std::string joined(const std::vector<std::string>& records)
{
    std::string text;
    for (const std::string& record : records)
        text += (text.empty() ? "" : " | ") + record;
    return text;
}
