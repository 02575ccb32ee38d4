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

// Appends a name that the list does not hold; buckets: records that the list has room for.
static void appendTablespace(tablespaceInfo* list, size_t buckets, const char* name, int* count)
{
    tablespaceInfo* tablespace = &list[*count];
    tablespace->id = *count;
    tablespace->deleted = 0;
    copyName(tablespace->name, name);
    enterName(list, buckets, static_cast<size_t>(*count));
    ++*count;
}

void addTablespacesFromHistEntryToList(tablespaceInfo* list, historyEntry* entry, int* count)
{
    size_t held = static_cast<size_t>(*count);
    size_t buckets = held + entry->numTablespaces;
    clearNames(list, buckets);
    for (size_t i = 0; i < held; i++)
        enterName(list, buckets, i);
    for (uint32_t i = 0; i < entry->numTablespaces; i++)
        if (findName(list, buckets, entry->tablespaceNames[i]) < 0)
            appendTablespace(list, buckets, entry->tablespaceNames[i], count);
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

// Puts a name of any length into a slot. False: no tablespace can have it.
static bool fillSlot(char* slot, const char* name)
{
    memset(slot, 0, nameSize);
    size_t length = strlen(name);
    memcpy(slot, name, length < nameSize ? length : 0);
    return length < nameSize;
}

// Marks in the list, by tracking, the tablespaces that the image holds.
static void markHeld(tablespaceInfo* list, size_t buckets, const historyEntry* image)
{
    for (uint32_t i = 0; i < image->numTablespaces; i++) {
        int held = findName(list, buckets, image->tablespaceNames[i]);
        if (held >= 0)
            list[held].tracking = 1;
    }
}

// Keeps the marked ones of the list's first count tablespaces. Returns their number.
static int keepMarked(tablespaceInfo* list, int count)
{
    int kept = 0;
    for (int i = 0; i < count; i++) {
        if (!list[i].tracking)
            continue;
        list[i].tracking = 0;
        copyName(list[kept].name, list[i].name);
        kept++;
    }
    return kept;
}

int listNamedTablespaces(restorePlan* plan, char** names, int numNames)
{
    int rc = increaseTablespaceList(0, numNames, &plan->list);
    if (rc != 0)
        return rc;

    char slot[nameSize];
    int count = 0;
    size_t buckets = static_cast<size_t>(numNames);
    for (int i = 0; i < numNames; i++) {
        str2upper(names[i]);
        if (fillSlot(slot, names[i]) && findName(plan->list, buckets, slot) < 0)
            appendTablespace(plan->list, buckets, slot, &count);
    }
    markHeld(plan->list, buckets, &plan->histData.entries[plan->histData.backupIndex]);
    for (int i = 0; i < numNames; i++)
        if (!fillSlot(slot, names[i]) || !plan->list[findName(plan->list, buckets, slot)].tracking)
            warnNotInImage(names[i]);
    plan->numTablespaces = keepMarked(plan->list, count);
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
    nameLinks links;
    int seenIn; // table: the last entry that was found to list the name
    char name[nameSize];
    char newName[nameSize];
};

// The renames met so far on the walk, newest first, and the table of their effect.
struct renameWalk {
    nameChange* renames;
    int numRenames;
    nameChange* effects;
    int numEffects;
    size_t buckets; // of effects
    bool oneByOne;  // a rename concerns ***
};

static bool isRename(const historyEntry* entry)
{
    return entry->operation == zq3OperationRename && entry->numTablespaces >= 2;
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

// What the table makes of a name; the name itself when no rename concerns it.
static const char* effectOn(const renameWalk* walk, const char* name)
{
    int effect = findName(walk->effects, walk->buckets, name);
    return effect < 0 ? name : walk->effects[effect].newName;
}

static void setEffect(renameWalk* walk, const char* name, const char* newName)
{
    int effect = findName(walk->effects, walk->buckets, name);
    if (effect < 0) {
        effect = walk->numEffects++;
        walk->effects[effect].seenIn = -1;
        copyName(walk->effects[effect].name, name);
        enterName(walk->effects, walk->buckets, static_cast<size_t>(effect));
    }
    copyName(walk->effects[effect].newName, newName);
}

static void addRename(renameWalk* walk, const historyEntry* entry)
{
    nameChange* rename = &walk->renames[walk->numRenames++];
    copyName(rename->name, entry->tablespaceNames[0]);
    copyName(rename->newName, entry->tablespaceNames[1]);
    if (strcmp(rename->name, DELETED_RENAMED) == 0 || strcmp(rename->newName, DELETED_RENAMED) == 0)
        walk->oneByOne = true;

    // The new name becomes *** first: of a rename to itself nothing else remains.
    char newest[nameSize];
    copyName(newest, effectOn(walk, rename->newName));
    setEffect(walk, rename->newName, DELETED_RENAMED);
    if (strcmp(rename->name, rename->newName) != 0)
        setEffect(walk, rename->name, newest);
}

// Tells how many of the entry's names the table changes; -1 when one of them is there twice.
static int countChanges(renameWalk* walk, const historyEntry* entry, int position)
{
    int changes = 0;
    for (uint32_t i = 0; i < entry->numTablespaces; i++) {
        int effect = findName(walk->effects, walk->buckets, entry->tablespaceNames[i]);
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
            applyRename(entry, walk->renames[i].name, walk->renames[i].newName);
        return;
    }
    for (uint32_t i = 0; i < entry->numTablespaces && changes > 0; i++) {
        int effect = findName(walk->effects, walk->buckets, entry->tablespaceNames[i]);
        if (effect < 0)
            continue;
        copyName(entry->tablespaceNames[i], walk->effects[effect].newName);
        changes--;
    }
}

// What the last entry listed before the renames, and the entry as they left it. Most entries list
// what their neighbour lists, and the same renames make the same of it: a comparison then stands
// for the look-up of every name.
struct lastNames {
    char (*before)[nameSize];  // room for the names of any entry
    const historyEntry* after; // null: nothing to compare with
};

static void renameLikeLast(renameWalk* walk, lastNames* last, historyEntry* entry, int position)
{
    size_t size = sizeof *entry->tablespaceNames * entry->numTablespaces;
    if (size == 0)
        return;
    if (last->after != nullptr && last->after->numTablespaces == entry->numTablespaces &&
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

// Allocates a walk for so many renames, in one block that starts with walk->renames and has room
// for so many names at its end. False: no memory.
static bool initWalk(renameWalk* walk, size_t numRenames, size_t mostNames, lastNames* last)
{
    *walk = {};
    *last = {};
    size_t changes = 3 * numRenames;
    size_t records = changes + mostNames * nameSize / sizeof(nameChange) + 1;
    if (numRenames > INT_MAX / 2)
        return false;
    walk->renames = static_cast<nameChange*>(calloc(records, sizeof(nameChange)));
    if (walk->renames == nullptr)
        return false;
    walk->effects = walk->renames + numRenames;
    walk->buckets = 2 * numRenames;
    last->before = reinterpret_cast<char(*)[nameSize]>(walk->renames + changes);
    return true;
}

int updateHistoryEntriesforRename(historyData* data)
{
    size_t mostNames = 0;
    size_t numRenames = data->renameIndex < 0 ? 0 : countRenames(data, &mostNames);
    if (numRenames == 0)
        return 0;

    renameWalk walk;
    lastNames last;
    if (!initWalk(&walk, numRenames, mostNames, &last))
        return reportError(msgNoMemoryImages);
    for (int i = data->backupIndex - 1; i >= 0; i--) {
        historyEntry* entry = &data->entries[i];
        if (i >= data->renameIndex && isRename(entry)) {
            addRename(&walk, entry);
            last.after = nullptr;
        }
        if (walk.numRenames > 0)
            renameLikeLast(&walk, &last, entry, i);
    }
    free(walk.renames);
    return 0;
}
