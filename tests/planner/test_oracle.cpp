// The stages against a slow planner written for this test: one walk for each tablespace, renames
// one by one, over random histories of few names and few days.
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "tool/zq3ckrst.h"

extern bool failCallocs;

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

History randomHistory(std::mt19937& random, const std::string& target)
{
    static const char* const pool[] = {"A", "B", "C", "TABLESPACE", "TABLESPACE_OF_18CH", "***"};
    static const char operations[] = "BBBBBBRRANNN", types[] = "FDDIIEO";
    auto pick = [&](size_t count) { return random() % count; };
    size_t poolSize = 3 + pick(4), length = 2 + pick(14);
    bool unique = pick(3) != 0;

    History history;
    for (size_t i = 0; i < length; i++) {
        Event event = {operations[pick(12)], types[pick(7)], day(1 + i + pick(2)), "", {}};
        if (event.operation == 'R')
            event.id = day(1 + pick(length));
        size_t numNames = event.operation == 'N' ? 1 + pick(7) / 2 : pick(poolSize + 1);
        for (size_t j = 0; j < numNames; j++) {
            std::string name = pool[pick(poolSize)];
            if (!unique || !lists(event.names, name))
                event.names.push_back(name);
        }
        history.push_back(event);
    }
    history[length - 1 - pick(2)] = {'B', types[pick(7)], target, "", {"A", "C", "B"}};
    return history;
}

std::string asScript(const History& history)
{
    std::string text = "@max 9";
    for (const Event& event : history) {
        text += std::string("\n") + event.operation + "D" + event.type + "A " + event.timestamp;
        for (const std::string& name : event.names)
            text += " " + name;
        text += event.id.empty() ? "" : " =" + event.id;
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
    size_t first = 0, oldest = 0;
    while (first < target && history[first].operation != 'N')
        first++;
    while (history[oldest].operation != 'B')
        oldest++;
    if (first == target || history[first].timestamp < history[oldest].timestamp)
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
    bool tracking = true, done = false;
    std::string awaited;
    for (size_t i = target + 1; i-- > 0;) {
        const Event& event = history[i];
        if (event.operation == 'B')
            cells += 'X';
        if (done || !lists(event.names, name))
            continue;
        if (event.operation == 'B') {
            if (!tracking && awaited > event.timestamp)
                return false;
            if (!tracking && awaited < event.timestamp)
                continue;
            tracking = true;
            cells.back() = strchr("IO", event.type) ? 'I' : strchr("DE", event.type) ? 'D' : 'F';
            done = cells.back() == 'F';
        } else if (event.operation == 'R' && tracking) {
            tracking = false;
            awaited = event.id;
        } else if (event.operation == 'A' && tracking) {
            done = true;
        }
    }
    return true;
}

// Keeps what the target needs; false when no full image starts the chain.
bool prune(std::string& cells)
{
    char wanted = cells[0]; // kind of the needed image met last
    bool drop = false;
    for (size_t i = 1; i < cells.size(); i++) {
        char cell = cells[i];
        bool starts = cell == 'F' || (cell == 'I' && wanted == 'D');
        if (wanted == 'F')
            drop = true;
        else if (wanted == 'I' || starts)
            drop = wanted == 'I' && cell != 'F';
        if (wanted != 'F' && starts)
            wanted = cell;
        if (drop)
            cells[i] = 'X';
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

std::string planSlowly(History history, const std::string& timestamp)
{
    std::stable_sort(history.begin(), history.end(),
                     [](const Event& a, const Event& b) { return a.timestamp < b.timestamp; });
    size_t target = 0;
    while (history[target].operation != 'B' || history[target].timestamp != timestamp)
        target++;
    renameSlowly(history, target);

    std::string result;
    for (const Event& event : history)
        result += listed(event.names);
    Names columns, cells;
    for (const std::string& name : history[target].names)
        if (!lists(columns, name))
            columns.push_back(name);
    for (const std::string& name : columns) {
        cells.emplace_back();
        if (!walkBack(history, target, name, cells.back()))
            return result + "missing image of " + name + "\n";
    }
    for (const std::string& column : cells)
        result += column + "\n";
    for (size_t i = 0; i < cells.size(); i++) {
        if (!prune(cells[i]))
            return result + "missing full image of " + columns[i] + "\n";
        result += cells[i] + "\n";
    }
    return result;
}

// --- The product's stages, in the same words ---

std::string columnsOf(const restorePlan& plan, int count)
{
    std::string text;
    for (int column = 0; column < count; column++) {
        for (int row = plan.numBackups - 1; row >= 0; row--)
            text += plan.matrix[row * plan.numTablespaces + column];
        text += "\n";
    }
    return text;
}

std::string planByStages(const std::string& timestamp, bool withIndexes)
{
    restorePlan plan = {};
    plan.histData.backupIndex = plan.histData.renameIndex = -1;
    char alias[] = "sample";
    EXPECT_EQ(0, fetchHistoryEntries(alias, std::string(timestamp).data(), &plan.histData,
                                     &plan.numBackups));
    EXPECT_EQ(listBackupImages(&plan), 0);

    failCallocs = !withIndexes;
    std::string result;
    if (isRenamePassDue(&plan))
        updateHistoryEntriesforRename(&plan.histData);
    for (int i = 0; i < plan.histData.numEntries; i++) {
        const historyEntry& entry = plan.histData.entries[i];
        result += listed({entry.tablespaceNames, entry.tablespaceNames + entry.numTablespaces});
    }
    EXPECT_EQ(listTargetTablespaces(&plan), 0);
    EXPECT_EQ(allocateTimelineMatrix(&plan), 0);
    int failed =
        fillColumns(plan.matrix, &plan.histData, plan.list, plan.numTablespaces, plan.numBackups);
    if (failed >= 0) {
        result += "missing image of " + std::string(plan.list[failed].name) + "\n";
    } else {
        result += columnsOf(plan, plan.numTablespaces);
        failed = scanColumns(plan.matrix, plan.numTablespaces, plan.numBackups);
        result += columnsOf(plan, failed < 0 ? plan.numTablespaces : failed);
        if (failed >= 0)
            result += "missing full image of " + std::string(plan.list[failed].name) + "\n";
    }
    failCallocs = false;
    freePlan(&plan);
    return result;
}
} // namespace

TEST(Oracle, StagesAgreeWithTheSlowPlanner)
{
    std::mt19937 random(20240104);
    int plans = 0, noImage = 0, noFull = 0;
    for (int run = 0; run < 3000; run++) {
        std::string timestamp = day(2 + random() % 16);
        History history = randomHistory(random, timestamp);
        std::string script = asScript(history);
        setenv("ZQ3SCRIPT", script.c_str(), 1);
        std::string expected = planSlowly(history, timestamp);
        ASSERT_EQ(planByStages(timestamp, true), expected) << script;
        ASSERT_EQ(planByStages(timestamp, false), expected) << script;
        noImage += expected.find("missing image") != std::string::npos;
        noFull += expected.find("missing full") != std::string::npos;
        plans += expected.find("missing") == std::string::npos;
    }
    EXPECT_GT(std::min({plans, noImage, noFull}), 200); // the histories reach every outcome
}
