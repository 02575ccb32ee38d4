// A client library that plays a script instead of reading a history. The text of the script is the
// value of ZQ3SCRIPT, one entry a line:
//
//   <operation><object><type><status> <timestamp[sequence]> [name...] [=id] [!sqlcode] ["command]
//
// where the sequence number is 001 when it is left out. Other lines:
//
//   @open|@close RESULT SQLCODE    outcome of the call
//   @get N RESULT SQLCODE          outcome of the N-th get, counted from 0
//   @max N                         maxTablespaces, whatever the entries list
//
// Whatever the caller does against the rules of the interface comes out on standard error.
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <sstream>
#include <string>
#include <vector>

#include "zq3.h"

namespace
{
struct Entry {
    std::string letters, objectPart, id, command;
    int sqlcode = 0;
    std::vector<std::string> names;
};

struct Script {
    std::vector<Entry> entries;
    int openResult = 0, openCode = 0, closeCode = 0, closeResult = 0;
    int failingGet = -1, getResult = 0, getCode = 0;
    size_t maxTablespaces = 0, next = 0;
    bool isOpen = false;
};
Script script;

void broken(bool isBroken, const char* rule)
{
    if (isBroken)
        fprintf(stderr, "scan interface misused: %s\n", rule);
}

Entry parseEntry(std::istringstream& line, const std::string& letters)
{
    Entry entry;
    entry.letters = letters;
    line >> entry.objectPart;
    if (entry.objectPart.size() == 14)
        entry.objectPart += "001";
    for (std::string word; line >> std::ws && line.peek() != '"' && line >> word;) {
        if (word[0] == '=')
            entry.id = word.substr(1);
        else if (word[0] == '!')
            entry.sqlcode = atoi(word.c_str() + 1);
        else
            entry.names.push_back(word);
    }
    line.get();
    getline(line, entry.command);
    return entry;
}

Script parseScript(const char* source)
{
    Script parsed;
    size_t largest = 0, maxGiven = SIZE_MAX;
    std::istringstream lines(source);
    for (std::string text; getline(lines, text);) {
        std::istringstream line(text);
        std::string word;
        line >> word;
        if (word == "@open")
            line >> parsed.openResult >> parsed.openCode;
        else if (word == "@close")
            line >> parsed.closeResult >> parsed.closeCode;
        else if (word == "@get")
            line >> parsed.failingGet >> parsed.getResult >> parsed.getCode;
        else if (word == "@max")
            line >> maxGiven;
        else
            parsed.entries.push_back(parseEntry(line, word));
    }
    for (const Entry& entry : parsed.entries)
        largest = std::max(largest, entry.names.size());
    parsed.maxTablespaces = maxGiven != SIZE_MAX ? maxGiven : largest;
    return parsed;
}

// Overwrites the whole buffer first: nobody may rely on what stands behind a terminator.
void deliver(const textBuffer& buffer, uint32_t capacity, const std::string& text)
{
    broken(buffer.capacity != capacity, "capacity of a text");
    memset(buffer.data, '#', std::min(capacity, 4096u));
    snprintf(buffer.data, capacity, "%s", text.c_str());
}

void deliverEntry(const Entry& entry, zq3HistoryData* record)
{
    static const uint32_t capacities[] = {18, 15, 13, 13, 25, 31, 129, 256, 31, 2097152};
    for (size_t i = 0; i < std::size(capacities); i++)
        deliver((&record->objectPart)[i], capacities[i], "unread");
    deliver(record->objectPart, 18, entry.objectPart);
    deliver(record->idText, 25, entry.id);
    deliver(record->commandText, 2097152, entry.command);
    record->commandText.data[2097152] = '\0'; // one byte more is the caller's
    record->eventSqlca->sqlcode = entry.sqlcode;
    broken(record->maxTablespaces != script.maxTablespaces, "room for names");
    record->numTablespaces = static_cast<uint32_t>(entry.names.size());
    for (uint32_t i = 0; i < record->numTablespaces && i < record->maxTablespaces; i++)
        deliver(record->tablespaceBuffers[i], 19, entry.names[i]);
    record->operation = entry.letters[0];
    record->object = entry.letters[1];
    record->operationType = entry.letters[2];
    record->status = entry.letters[3];
}

__attribute__((destructor)) void checkClosed()
{
    broken(script.isOpen, "no close");
}
} // namespace

extern "C" int zq3HistoryOpenScan(unsigned int version, void* openStruct, sqlca* ca)
{
    auto scan = static_cast<zq3HistoryOpenStruct*>(openStruct);
    broken(version != 6010000 || scan->callerAction || scan->timestamp || scan->objectName, "open");
    script = parseScript(getenv("ZQ3SCRIPT"));
    script.isOpen = true; // to be closed even when the open fails
    scan->numRows = static_cast<uint32_t>(script.entries.size());
    scan->maxTablespaces = static_cast<uint32_t>(script.maxTablespaces);
    scan->handle = 4711;
    ca->sqlcode = script.openCode;
    return script.openResult;
}

extern "C" int zq3HistoryGetEntry(unsigned int version, void* fetchStruct, sqlca* ca)
{
    auto fetch = static_cast<zq3HistoryFetchStruct*>(fetchStruct);
    broken(version != 6010000 || fetch->callerAction != 2 || fetch->handle != 4711, "get");
    broken(script.next >= script.entries.size() || script.maxTablespaces == 0, "too many gets");
    bool fails = script.failingGet == static_cast<int>(script.next);
    ca->sqlcode = fails ? script.getCode : 0;
    deliverEntry(script.entries[script.next++], fetch->historyRecord);
    return fails ? script.getResult : 0;
}

extern "C" int zq3HistoryCloseScan(unsigned int version, void* handle, sqlca* ca)
{
    broken(version != 6010000 || *static_cast<uint16_t*>(handle) != 4711, "close");
    ca->sqlcode = script.closeCode;
    script.isOpen = false;
    return script.closeResult;
}
