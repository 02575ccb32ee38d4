// The tablespaces of a restore: the list, the look-ups, and the names they bore before renames.
#include <cctype>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "tool/nameindex.h"
#include "tool/zq3ckrst.h"

const char DELETED_RENAMED[nameSize] = "***";

void str2upper(char* text)
{
    for (; *text != '\0'; text++)
        *text = static_cast<char>(toupper(static_cast<unsigned char>(*text)));
}

// --- The list ------------------------------------------------------------------------------------

int increaseTablespaceList(int current, int increment, tablespaceInfo** list)
{
    size_t size = static_cast<size_t>(current) + static_cast<size_t>(increment);
    if (size > SIZE_MAX / sizeof(tablespaceInfo))
        return reportError(msgNoMemoryList);
    void* grown = realloc(*list, size * sizeof(tablespaceInfo));
    if (grown == nullptr)
        return reportError(msgNoMemoryList);

    *list = static_cast<tablespaceInfo*>(grown);
    memset(static_cast<void*>(*list + current), 0,
           static_cast<size_t>(increment) * sizeof(tablespaceInfo));
    return 0;
}

bool isTablespaceInList(tablespaceInfo* list, char* name, int count, int* index)
{
    int found = -1;
    for (int i = 0; i < count && found < 0; i++)
        if (strcmp(list[i].name, name) == 0)
            found = i;
    if (index != nullptr)
        *index = found;
    return found >= 0;
}

bool isTablespaceInHistoryEntry(historyEntry* entry, char* name, int* index)
{
    int found = -1;
    for (uint32_t i = 0; i < entry->numTablespaces && found < 0; i++)
        if (strcmp(entry->tablespaceNames[i], name) == 0)
            found = static_cast<int>(i);
    if (index != nullptr)
        *index = found;
    return found >= 0;
}

static void appendTablespace(tablespaceInfo* list, const char* name, int* count)
{
    tablespaceInfo* tablespace = &list[*count];
    tablespace->id = *count;
    tablespace->deleted = 0;
    snprintf(tablespace->name, sizeof tablespace->name, "%s", name);
    ++*count;
}

// Enters the list's first count names in a new index with room for more. False: no memory.
static bool indexList(nameIndex* index, const tablespaceInfo* list, int count, size_t more)
{
    if (!initNameIndex(index, static_cast<size_t>(count) + more))
        return false;
    for (int i = 0; i < count; i++)
        enterName(index, list[i].name, i);
    return true;
}

void addTablespacesFromHistEntryToList(tablespaceInfo* list, historyEntry* entry, int* count)
{
    nameIndex index;
    bool indexed = indexList(&index, list, *count, entry->numTablespaces);

    for (uint32_t i = 0; i < entry->numTablespaces; i++) {
        char* name = entry->tablespaceNames[i];
        bool isNew = indexed ? enterName(&index, name, *count)
                             : !isTablespaceInList(list, name, *count, nullptr);
        if (isNew)
            appendTablespace(list, name, count);
    }
    freeNameIndex(&index);
}

int listTargetTablespaces(restorePlan* plan)
{
    historyEntry* target = &plan->histData.entries[plan->histData.backupIndex];
    if (target->numTablespaces == 0)
        return 0;
    if (target->numTablespaces > INT_MAX)
        return reportError(msgNoMemoryList);

    int rc = increaseTablespaceList(0, static_cast<int>(target->numTablespaces), &plan->list);
    if (rc == 0)
        addTablespacesFromHistEntryToList(plan->list, target, &plan->numTablespaces);
    return rc;
}

static void warnNotInImage(const char* name)
{
    fflush(stdout);
    fprintf(stderr, "\nWARNING:  zq3ckrst - Tablespace name \"%s\" is not in the\n", name);
    fprintf(stderr, "                     image specified; will try to continue with\n");
    fprintf(stderr, "                     remaining valid names.\n\n");
}

// Enters the names of an entry in a new index. False: no memory.
static bool indexEntry(nameIndex* index, historyEntry* entry)
{
    if (!initNameIndex(index, entry->numTablespaces))
        return false;
    for (uint32_t i = 0; i < entry->numTablespaces; i++)
        enterName(index, entry->tablespaceNames[i], static_cast<int>(i));
    return true;
}

// Tells whether the entry, indexed or not, holds a name of any length; *slot receives its slot.
static bool findInEntry(const nameIndex* index, historyEntry* entry, char* name, int* slot)
{
    if (index->slots == nullptr)
        return isTablespaceInHistoryEntry(entry, name, slot);

    char padded[nameSize] = {};
    size_t length = strlen(name);
    memcpy(padded, name, length < nameSize ? length : 0);
    *slot = length < nameSize ? findName(index, padded) : -1;
    return *slot >= 0;
}

int listNamedTablespaces(restorePlan* plan, char** names, int numNames)
{
    historyEntry* target = &plan->histData.entries[plan->histData.backupIndex];
    int rc = increaseTablespaceList(0, numNames, &plan->list);
    if (rc != 0)
        return rc;

    nameIndex imageIndex, listIndex;
    indexEntry(&imageIndex, target);
    bool indexed = indexList(&listIndex, nullptr, 0, static_cast<size_t>(numNames));

    for (int i = 0; i < numNames; i++) {
        int slot;
        str2upper(names[i]);
        if (!findInEntry(&imageIndex, target, names[i], &slot)) {
            warnNotInImage(names[i]);
            continue;
        }
        char* name = target->tablespaceNames[slot];
        if (indexed ? enterName(&listIndex, name, plan->numTablespaces)
                    : !isTablespaceInList(plan->list, name, plan->numTablespaces, nullptr))
            appendTablespace(plan->list, name, &plan->numTablespaces);
    }
    freeNameIndex(&imageIndex);
    freeNameIndex(&listIndex);
    return plan->numTablespaces == 0 ? reportError(msgNoValidNames) : 0;
}

// --- Renames -------------------------------------------------------------------------------------
//
// A rename at position i turns, in every entry from i back to the first, the new name into *** and
// then the old name into the new one; renames act from the oldest to the newest, so an entry meets
// all renames that are not older than itself.
//
// Done rename by rename, that is renames times entries. Instead one walk from the newest entry to
// the oldest keeps a table of what all renames met so far make of a name: a rename that is met on
// the way back acts before those in the table, so it enters its new name as *** and its old name as
// whatever the table makes of its new one. That is exact as long as no name is twice in an entry
// (only the first of the two would be turned) and *** is no name of a rename; an entry with such a
// name gets its renames one by one.

// A rename, or what the table makes of a name.
struct nameChange {
    char from[nameSize];
    char to[nameSize];
    int seenIn; // table: the last entry that was found to list the name
};

// The renames met so far on the walk, newest first, and the table of their effect.
struct renameWalk {
    nameChange* renames;
    int numRenames;
    nameChange* effects;
    int numEffects;
    nameIndex index; // of effects
    bool oneByOne;   // a rename concerns ***
};

static bool isRename(const historyEntry* entry)
{
    return entry->operation == 'N' && entry->numTablespaces >= 2;
}

bool isRenamePassDue(restorePlan* plan)
{
    const historyData* data = &plan->histData;
    return data->renameIndex != -1 && memcmp(data->entries[data->renameIndex].timestamp,
                                             plan->images[0].timestamp, timestampLength) >= 0;
}

static void applyRename(historyEntry* entry, char* oldName, char* newName)
{
    int slot;
    if (isTablespaceInHistoryEntry(entry, newName, &slot))
        copyName(entry->tablespaceNames[slot], DELETED_RENAMED);
    if (isTablespaceInHistoryEntry(entry, oldName, &slot))
        copyName(entry->tablespaceNames[slot], newName);
}

// The pass without a table, for want of memory.
static void renameOneByOne(historyData* data)
{
    for (int i = data->renameIndex; i < data->backupIndex; i++) {
        if (!isRename(&data->entries[i]))
            continue;
        char oldName[nameSize], newName[nameSize];
        copyName(oldName, data->entries[i].tablespaceNames[0]);
        copyName(newName, data->entries[i].tablespaceNames[1]);
        for (int j = i; j >= 0; j--)
            applyRename(&data->entries[j], oldName, newName);
    }
}

// What the table makes of a name; the name itself when no rename concerns it.
static const char* effectOn(const renameWalk* walk, const char* name)
{
    int effect = findName(&walk->index, name);
    return effect < 0 ? name : walk->effects[effect].to;
}

static void setEffect(renameWalk* walk, const char* from, const char* to)
{
    if (enterName(&walk->index, from, walk->numEffects)) {
        copyName(walk->effects[walk->numEffects].from, from);
        walk->effects[walk->numEffects].seenIn = -1;
        walk->numEffects++;
    }
    copyName(walk->effects[findName(&walk->index, from)].to, to);
}

static void addRename(renameWalk* walk, const historyEntry* entry)
{
    nameChange* rename = &walk->renames[walk->numRenames++];
    copyName(rename->from, entry->tablespaceNames[0]);
    copyName(rename->to, entry->tablespaceNames[1]);
    if (strcmp(rename->from, DELETED_RENAMED) == 0 || strcmp(rename->to, DELETED_RENAMED) == 0)
        walk->oneByOne = true;

    // The new name becomes *** first: of a rename to itself nothing else remains.
    char newest[nameSize];
    copyName(newest, effectOn(walk, rename->to));
    setEffect(walk, rename->to, DELETED_RENAMED);
    if (strcmp(rename->from, rename->to) != 0)
        setEffect(walk, rename->from, newest);
}

// Tells how many of the entry's names the table changes; -1 when one of them is there twice.
static int countChanges(renameWalk* walk, const historyEntry* entry, int position)
{
    int changes = 0;
    for (uint32_t i = 0; i < entry->numTablespaces; i++) {
        int effect = findName(&walk->index, entry->tablespaceNames[i]);
        if (effect < 0)
            continue;
        if (walk->effects[effect].seenIn == position)
            return -1;
        walk->effects[effect].seenIn = position;
        changes++;
    }
    return changes;
}

static void renameInEntry(renameWalk* walk, historyEntry* entry, int position)
{
    int changes = walk->oneByOne ? -1 : countChanges(walk, entry, position);
    if (changes < 0) {
        for (int i = walk->numRenames - 1; i >= 0; i--)
            applyRename(entry, walk->renames[i].from, walk->renames[i].to);
        return;
    }
    for (uint32_t i = 0; i < entry->numTablespaces && changes > 0; i++) {
        int effect = findName(&walk->index, entry->tablespaceNames[i]);
        if (effect < 0)
            continue;
        copyName(entry->tablespaceNames[i], walk->effects[effect].to);
        changes--;
    }
}

// Allocates a walk for so many renames. False: no memory; what was allocated is freed by freeWalk.
static bool initWalk(renameWalk* walk, size_t numRenames)
{
    *walk = {};
    walk->renames = static_cast<nameChange*>(calloc(numRenames, sizeof(nameChange)));
    walk->effects = static_cast<nameChange*>(calloc(numRenames, 2 * sizeof(nameChange)));
    return walk->renames != nullptr && walk->effects != nullptr &&
           initNameIndex(&walk->index, numRenames * 2);
}

static void freeWalk(renameWalk* walk)
{
    free(walk->renames);
    free(walk->effects);
    freeNameIndex(&walk->index);
}

// What the last entry listed before the renames, and the entry as they left it. Most entries list
// what their neighbour lists, and the same renames make the same of it: a comparison then stands
// for the look-up of every name.
struct lastNames {
    char (*before)[nameSize];  // room for the names of any entry; null: no memory
    const historyEntry* after; // null: nothing to compare with
};

static void renameLikeLast(renameWalk* walk, lastNames* last, historyEntry* entry, int position)
{
    size_t size = sizeof *entry->tablespaceNames * entry->numTablespaces;
    if (last->before == nullptr || size == 0) {
        renameInEntry(walk, entry, position);
    } else if (last->after != nullptr && last->after->numTablespaces == entry->numTablespaces &&
               memcmp(last->before, entry->tablespaceNames, size) == 0) {
        memcpy(entry->tablespaceNames, last->after->tablespaceNames, size);
    } else {
        memcpy(last->before, entry->tablespaceNames, size);
        renameInEntry(walk, entry, position);
        last->after = entry;
    }
}

// Counts the renames before the target, and the names of the longest entry.
static size_t countRenames(const historyData* data, size_t* mostNames)
{
    size_t numRenames = 0;
    *mostNames = 0;
    for (int i = 0; i < data->backupIndex; i++) {
        const historyEntry* entry = &data->entries[i];
        if (i >= data->renameIndex && isRename(entry))
            numRenames++;
        if (entry->numTablespaces > *mostNames)
            *mostNames = entry->numTablespaces;
    }
    return numRenames;
}

void updateHistoryEntriesforRename(historyData* data)
{
    size_t mostNames = 0;
    size_t numRenames = data->renameIndex < 0 ? 0 : countRenames(data, &mostNames);
    if (numRenames == 0)
        return;

    renameWalk walk;
    bool allocated = initWalk(&walk, numRenames);
    // No more than the largest entry's own names take, which were allocated.
    lastNames last = {static_cast<char(*)[nameSize]>(malloc(mostNames * nameSize)), nullptr};
    for (int i = data->backupIndex - 1; allocated && i >= 0; i--) {
        historyEntry* entry = &data->entries[i];
        if (i >= data->renameIndex && isRename(entry)) {
            addRename(&walk, entry);
            last.after = nullptr;
        }
        if (walk.numRenames > 0)
            renameLikeLast(&walk, &last, entry, i);
    }
    if (!allocated)
        renameOneByOne(data);
    free(last.before);
    freeWalk(&walk);
}
