// The stages against a slow planner written for this test: one walk for each tablespace, renames
// one by one, no list shared, over random histories of few names and few days.
#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <random>
#include <set>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tool/zq3ckrst.h"

namespace
{
using Names = std::vector<std::string>;
struct Event {
    char operation, type;
    std::string timestamp, id;
    Names names;
};
using History = std::vector<Event>;

std::string day(size_t number)
{
    return std::to_string(20240100 + number) + "000000";
}

bool lists(const Names& names, const std::string& name)
{
    return std::find(names.begin(), names.end(), name) != names.end();
}

// So many names, or fewer, of a few; unique: none twice.
Names randomNames(std::mt19937& random, size_t count, size_t poolSize, bool unique)
{
    static const char* const pool[] = {"A", "B", "C", "TABLESPACE", "TABLESPACE_OF_18CH", "***"};
    Names names;
    for (size_t i = 0; i < count; i++) {
        std::string name = pool[random() % poolSize];
        if (!unique || !lists(names, name))
            names.push_back(name);
    }
    return names;
}

History randomHistory(std::mt19937& random, const std::string& target)
{
    static const char operations[] = "BBBBBBRRANNN", types[] = "FDDIIEO";
    auto pick = [&](size_t count) { return random() % count; };
    size_t poolSize = 3 + pick(4), length = 2 + pick(14);
    bool unique = pick(3) != 0, wide = pick(300) == 0;

    History history(length);
    for (size_t i = 0; i < length; i++) {
        Event& event = history[i];
        event = {operations[pick(12)], types[pick(7)], day(1 + i + pick(2)), "", {}};
        if (event.operation == 'R')
            event.id = day(1 + pick(length));
        size_t numNames = event.operation == 'N' ? 1 + pick(7) / 2 : pick(poolSize + 1);
        event.names = randomNames(random, numNames, poolSize, unique);
        if (i > 0 && event.operation != 'N' && pick(2) == 0) // a list that entries share
            event.names = history[i - 1 - pick(i)].names;
    }
    history[length - 1 - pick(2)] = {'B', types[pick(7)], target, "", {"A", "C", "B"}};
    for (Event& event : history) // more columns than are scanned side by side
        for (size_t i = 1000; i < 2050 && wide && event.operation == 'B'; i++)
            event.names.push_back("TABLESPACE_OF_" + std::to_string(i));
    if (pick(4) == 0)
        std::shuffle(history.begin(), history.end(), random);
    return history;
}

std::string asScript(const History& history)
{
    std::string text;
    for (const Event& event : history) {
        text += std::string() + event.operation + "D" + event.type + "A " + event.timestamp;
        for (const std::string& name : event.names)
            text += " " + name;
        text += (event.id.empty() ? "" : " =" + event.id) + "\n";
    }
    return text;
}

// --- The slow planner ---

void replaceFirst(Names& names, const std::string& from, const std::string& to)
{
    auto found = std::find(names.begin(), names.end(), from);
    if (found != names.end())
        *found = to;
}

void renameSlowly(History& history, size_t target)
{
    auto firstOf = [&](char operation) {
        size_t at = 0;
        while (at < target && history[at].operation != operation)
            at++;
        return at;
    };
    size_t first = firstOf('N');
    if (history[first].timestamp < history[firstOf('B')].timestamp)
        return;
    for (size_t i = first; i < target; i++) {
        if (history[i].operation != 'N' || history[i].names.size() < 2)
            continue;
        std::string from = history[i].names[0], to = history[i].names[1];
        for (size_t j = i + 1; j-- > 0;) {
            replaceFirst(history[j].names, to, "***");
            replaceFirst(history[j].names, from, to);
        }
    }
}

// The cells of one tablespace, the target's first; false when a restored image is missing.
bool walkBack(const History& history, size_t target, const std::string& name, std::string& cells)
{
    bool done = false;
    std::string awaited; // timestamp of the image that a restore used; empty: any image counts
    for (size_t i = target + 1; i-- > 0;) {
        const Event& event = history[i];
        bool isImage = event.operation == 'B';
        cells += isImage ? "X" : "";
        if (done || !lists(event.names, name))
            continue;
        if (isImage && awaited > event.timestamp)
            return false;
        if (isImage && (awaited.empty() || awaited == event.timestamp)) {
            awaited.clear();
            cells.back() = strchr("IO", event.type) ? 'I' : strchr("DE", event.type) ? 'D' : 'F';
        }
        done = awaited.empty() && (event.operation == 'A' || cells.back() == 'F');
        if (awaited.empty() && event.operation == 'R')
            awaited = event.id;
    }
    return true;
}

// Keeps what the target needs; false when no full image starts the chain.
bool prune(std::string& cells)
{
    char wanted = 'D'; // the needed image met last; a delta needs whatever is older
    for (char& cell : cells) {
        if (wanted == 'F' || (wanted == 'I' && cell != 'F'))
            cell = 'X';
        else if (cell == 'F' || cell == 'I')
            wanted = cell;
    }
    return wanted == 'F';
}

std::string listed(const Names& names)
{
    std::string text;
    for (const std::string& name : names)
        text += name + " ";
    return text + "\n";
}

// asked: the tablespaces to restore; none: all of the target.
std::string planSlowly(History history, const std::string& timestamp, const Names& asked)
{
    std::stable_sort(history.begin(), history.end(),
                     [](const Event& a, const Event& b) { return a.timestamp < b.timestamp; });
    size_t target = 0;
    while (history[target].operation != 'B' || history[target].timestamp != timestamp)
        target++;
    renameSlowly(history, target);

    std::string result, filled, pruned, failure;
    for (const Event& event : history)
        result += listed(event.names);
    Names columns;
    for (const std::string& name : asked.empty() ? history[target].names : asked) {
        if (lists(columns, name) || !lists(history[target].names, name))
            continue;
        columns.push_back(name);
        std::string cells;
        if (!walkBack(history, target, name, cells))
            return result + "missing: " + name;
        filled += cells + "\n";
        if (!prune(cells) && failure.empty())
            failure = "missing: " + name;
        pruned += cells + "\n";
    }
    return result + filled + pruned + failure;
}

// --- The product's stages, in the same words ---

std::string columnsOf(const restorePlan& plan)
{
    std::string text;
    for (int column = 0; column < plan.numTablespaces; column++) {
        for (int row = plan.numBackups - 1; row >= 0; row--)
            text += plan.matrix[row * plan.numTablespaces + column];
        text += "\n";
    }
    return text;
}

size_t numLists(const historyData& data)
{
    std::set<const nameList*> lists;
    for (int i = 0; i < data.numEntries; i++)
        lists.insert(namesOfEntry(&data.entries[i]));
    return lists.size();
}

// Renames act from the oldest to the newest, so that they can be applied in several goes.
void renameInTwoGoes(historyData* data)
{
    int target = data->backupIndex;
    data->backupIndex = (data->renameIndex + target) / 2;
    EXPECT_EQ(updateHistoryEntriesforRename(data), 0);
    data->renameIndex = data->backupIndex;
    data->backupIndex = target;
    EXPECT_EQ(updateHistoryEntriesforRename(data), 0);
}

void listAsked(restorePlan* plan, Names asked)
{
    std::vector<char*> names;
    for (std::string& name : asked)
        names.push_back(name.data());
    int rc = names.empty() ? listTargetTablespaces(plan)
                           : listNamedTablespaces(plan, names.data(), int(names.size()));
    EXPECT_EQ(rc, plan->numTablespaces == 0 && !names.empty() ? argumentMissing : 0);
    historyEntry* target = &plan->histData.entries[plan->histData.backupIndex];
    for (char* name : names)
        EXPECT_EQ(isNameListed(plan, name), isTablespaceInHistoryEntry(target, name, nullptr));
}

std::string timelines(restorePlan& plan)
{
    std::string result;
    EXPECT_EQ(allocateTimelineMatrix(&plan), 0);
    int failed =
        fillColumns(plan.matrix, &plan.histData, plan.list, plan.numTablespaces, plan.numBackups);
    if (failed < 0) {
        result += columnsOf(plan);
        failed = scanColumns(plan.matrix, plan.numTablespaces, plan.numBackups);
        result += columnsOf(plan);
    }
    if (failed >= 0)
        result += std::string("missing: ") + plan.list[failed].name;
    return result;
}

std::string planByStages(std::string timestamp, const Names& asked, size_t* lists)
{
    restorePlan plan = {};
    plan.histData.backupIndex = plan.histData.renameIndex = -1;
    char alias[] = "sample";
    EXPECT_EQ(0, fetchHistoryEntries(alias, timestamp.data(), &plan.histData, &plan.numBackups));
    EXPECT_EQ(listBackupImages(&plan), 0);
    *lists += numLists(plan.histData);

    std::string result;
    if (isRenamePassDue(&plan))
        renameInTwoGoes(&plan.histData);
    for (int i = 0; i < plan.histData.numEntries; i++) {
        const historyEntry& entry = plan.histData.entries[i];
        result += listed({entry.tablespaceNames, entry.tablespaceNames + entry.numTablespaces});
    }
    listAsked(&plan, asked);
    result += timelines(plan);
    freePlan(&plan);
    return result;
}
} // namespace

TEST(Oracle, StagesAgreeWithTheSlowPlanner)
{
    std::mt19937 random(20240104);
    int plans = 0;
    size_t lists = 0, differentLists = 0;
    for (int run = 0; run < 3000; run++) {
        std::string timestamp = day(2 + random() % 16);
        History history = randomHistory(random, timestamp);
        Names asked = randomNames(random, random() % 3, 6, false);
        std::string script = asScript(history), expected = planSlowly(history, timestamp, asked);
        std::set<Names> different;
        for (const Event& event : history)
            different.insert(event.names);
        differentLists += different.size();
        setenv("ZQ3SCRIPT", script.c_str(), 1);
        ASSERT_EQ(planByStages(timestamp, asked, &lists), expected) << script;
        plans += expected.find("missing") == std::string::npos;
    }
    EXPECT_LT(lists, differentLists * 101 / 100);  // two lists with one place among the recent ones
    EXPECT_GT(std::min(plans, 3000 - plans), 500); // the histories reach both outcomes
}

TEST(List, KeepsEachNameOnceAndFindsItByAllItsBytes)
{
    char names[][nameSize] = {"A", "TABLESPACE1NAME18X", "A", "TABLESPACE1NAME18Y"};
    historyEntry entry = {};
    entry.tablespaceNames = names;
    entry.numTablespaces = 4;
    tablespaceInfo* list = nullptr;
    ASSERT_EQ(0, increaseTablespaceList(0, 4, &list));
    int count = 0, place = 0;
    addTablespacesFromHistEntryToList(list, &entry, &count);
    EXPECT_EQ(3, count);
    char last[] = "TABLESPACE1NAME18Y", other[] = "a";
    EXPECT_TRUE(isTablespaceInList(list, last, 3, &place));
    EXPECT_EQ(2, place);
    EXPECT_FALSE(isTablespaceInList(list, last, 2, &place));
    EXPECT_EQ(-1, place);
    EXPECT_TRUE(isTablespaceInHistoryEntry(&entry, last, &place));
    EXPECT_EQ(3, place);
    EXPECT_FALSE(isTablespaceInHistoryEntry(&entry, other, nullptr));
    free(list);
}
