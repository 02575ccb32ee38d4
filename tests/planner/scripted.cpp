// A client library that plays a script instead of reading a history. The text of the script is the
// value of ZQ3SCRIPT, one entry a line:
//
//   <operation><object><type><status> <timestamp[sequence]> [name...] [=id] [!sqlcode] ["command]
//
// where the sequence number is 001 when it is left out. Other lines, gets being counted from 0:
//
//   @open|@close|@get<N> RESULT SQLCODE    outcome of a call
//   @max N                                 maxTablespaces, whatever the entries list
//
// Whatever the caller does against the rules of the interface comes out on standard error.
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "zq3.h"

namespace
{
struct Script {
    std::vector<std::string> entries;
    std::map<std::string, std::pair<int, int>> outcomes; // by call: result and SQLCODE
    size_t maxTablespaces = 0, numGets = 0;
    bool isOpen = false;
};
Script script;

void broken(bool isBroken, const char* rule)
{
    if (isBroken)
        fprintf(stderr, "scan interface misused: %s\n", rule);
}

void readScript(const char* source)
{
    script = {};
    std::istringstream lines(source);
    for (std::string line; getline(lines, line);) {
        if (line[0] == '@') {
            std::istringstream words(line);
            std::string call;
            words >> call >> script.outcomes[call].first >> script.outcomes[call].second;
        } else {
            long blanks = std::count(line.begin(), line.end(), ' '); // one more than names, or more
            script.maxTablespaces =
                std::max(script.maxTablespaces, static_cast<size_t>(blanks - 1));
            script.entries.push_back(line);
        }
    }
    if (script.outcomes.contains("@max"))
        script.maxTablespaces = static_cast<size_t>(script.outcomes["@max"].first);
}

// Overwrites the whole buffer first: nobody may rely on what stands after a terminator.
void deliver(const textBuffer& buffer, uint32_t capacity, const std::string& text)
{
    broken(buffer.capacity != capacity, "capacity of a text");
    memset(buffer.data, '#', std::min(capacity, 4096u));
    snprintf(buffer.data, capacity, "%s", text.c_str());
}

// The names, the id and the SQLCODE of an entry.
void deliverWords(std::istringstream& words, zq3HistoryData* record)
{
    broken(record->maxTablespaces != script.maxTablespaces, "room for names");
    record->eventSqlca->sqlcode = 0;
    record->numTablespaces = 0;
    for (std::string word; words >> word;) {
        if (word[0] == '=')
            deliver(record->idText, 25, word.substr(1));
        else if (word[0] == '!')
            record->eventSqlca->sqlcode = atoi(word.c_str() + 1);
        else if (record->numTablespaces++ < record->maxTablespaces)
            deliver(record->tablespaceBuffers[record->numTablespaces - 1], 19, word);
    }
}

void deliverEntry(const std::string& line, zq3HistoryData* record)
{
    static const uint32_t capacities[] = {18, 15, 13, 13, 25, 31, 129, 256, 31, 2097152};
    size_t quote = std::min(line.find('"'), line.size());
    std::istringstream words(line.substr(0, quote));
    std::string letters, objectPart;
    words >> letters >> objectPart;
    for (size_t i = 0; i < std::size(capacities); i++)
        deliver((&record->objectPart)[i], capacities[i], "unread");
    deliver(record->objectPart, 18, objectPart + (objectPart.size() == 14 ? "001" : ""));
    deliver(record->commandText, 2097152, line.substr(std::min(quote + 1, line.size())));
    record->commandText.data[2097152] = '\0'; // one byte more is the caller's
    deliverWords(words, record);
    record->operation = letters[0];
    record->object = letters[1];
    record->operationType = letters[2];
    record->status = letters[3];
}

int end(const std::string& call, sqlca* ca)
{
    ca->sqlcode = script.outcomes[call].second;
    return script.outcomes[call].first;
}

__attribute__((destructor)) void checkClosed()
{
    broken(script.isOpen, "no close");
}
} // namespace

extern "C" int zq3HistoryOpenScan(unsigned int, void* openStruct, sqlca* ca)
{
    auto scan = static_cast<zq3HistoryOpenStruct*>(openStruct);
    readScript(getenv("ZQ3SCRIPT"));
    script.isOpen = true; // to be closed even when the open fails
    scan->numRows = static_cast<uint32_t>(script.entries.size());
    scan->maxTablespaces = static_cast<uint32_t>(script.maxTablespaces);
    return end("@open", ca);
}

extern "C" int zq3HistoryGetEntry(unsigned int, void* fetchStruct, sqlca* ca)
{
    auto fetch = static_cast<zq3HistoryFetchStruct*>(fetchStruct);
    broken(script.numGets >= script.entries.size() || script.maxTablespaces == 0, "too many gets");
    deliverEntry(script.entries[script.numGets], fetch->historyRecord);
    return end("@get" + std::to_string(script.numGets++), ca);
}

extern "C" int zq3HistoryCloseScan(unsigned int, void*, sqlca* ca)
{
    script.isOpen = false;
    return end("@close", ca);
}
