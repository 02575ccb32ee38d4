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
        return failStage(msgNoMemoryList);
    void* grown = realloc(*list, size * sizeof(tablespaceInfo));
    if (grown == nullptr)
        return failStage(msgNoMemoryList);

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
    enterNames(list, buckets, held);
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
        return failStage(msgNoMemoryList);

    int rc = increaseTablespaceList(0, static_cast<int>(target->numTablespaces), &plan->list);
    if (rc == 0)
        addTablespacesFromHistEntryToList(plan->list, target, &plan->numTablespaces);
    return rc;
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
    enterNames(list, static_cast<size_t>(kept), static_cast<size_t>(kept));
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
    plan->numTablespaces = keepMarked(plan->list, count);
    return plan->numTablespaces == 0 ? failStage(msgNoValidNames) : 0;
}

bool isNameListed(const restorePlan* plan, const char* name)
{
    char slot[nameSize];
    size_t buckets = static_cast<size_t>(plan->numTablespaces);
    return buckets > 0 && fillSlot(slot, name) && findName(plan->list, buckets, slot) >= 0;
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
    int seenIn; // table: the last list, in the order of the walk, that was found to hold the name
    char name[nameSize];
    char newName[nameSize];
};

// What the table makes of the name that the list looked at last had in one of its slots.
struct slotEffect {
    char name[nameSize];
    int effect; // -1: none
};

// The renames met so far on the walk, newest first, and the table of their effect.
struct renameWalk {
    nameChange* renames;
    int numRenames;
    nameChange* effects;
    int numEffects;
    size_t buckets; // of effects
    slotEffect* slots;
    uint32_t numSlots; // whose effects hold
    int numLists;      // looked at so far
    bool oneByOne;     // a rename concerns ***
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
        walk->effects[effect].seenIn = 0;
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
    walk->numSlots = 0;
}

// The effect on the name in a slot, slots being taken in order. Lists mostly differ in few names,
// so the effect is mostly that on the last list's name.
static int effectInSlot(renameWalk* walk, uint32_t number, const char* name)
{
    slotEffect* slot = &walk->slots[number];
    if (number < walk->numSlots && memcmp(slot->name, name, nameSize) == 0)
        return slot->effect;
    if (number == walk->numSlots)
        walk->numSlots++;
    memcpy(slot->name, name, nameSize);
    slot->effect = findName(walk->effects, walk->buckets, name);
    return slot->effect;
}

// Tells how many of the entry's names the table changes; -1 when one of them is there twice.
static int countChanges(renameWalk* walk, const historyEntry* entry)
{
    int changes = 0;
    walk->numLists++;
    for (uint32_t i = 0; i < entry->numTablespaces; i++) {
        int effect = effectInSlot(walk, i, entry->tablespaceNames[i]);
        if (effect < 0)
            continue;
        if (walk->effects[effect].seenIn == walk->numLists)
            return -1;
        walk->effects[effect].seenIn = walk->numLists;
        changes++;
    }
    return changes;
}

// Makes the changes that were counted in the entry's list, which no other entry has.
static void makeChanges(renameWalk* walk, historyEntry* entry, int changes)
{
    if (changes < 0) {
        for (int i = walk->numRenames - 1; i >= 0; i--)
            applyRename(entry, walk->renames[i].name, walk->renames[i].newName);
        return;
    }
    for (uint32_t i = 0; i < entry->numTablespaces && changes > 0; i++) {
        int effect = walk->slots[i].effect;
        if (effect < 0)
            continue;
        copyName(entry->tablespaceNames[i], walk->effects[effect].newName);
        changes--;
    }
}

// The same renames make the same of a list, whichever entry has it: only the first entry looks up
// its names. Entries before the next older rename may have the list, too, so it is left alone.
static int renameInEntry(renameWalk* walk, historyEntry* entry)
{
    nameList* list = namesOfEntry(entry);
    if (list == nullptr)
        return 0;
    if (list->renamedBy == walk->numRenames) {
        giveNames(entry, list->renamed);
        return 0;
    }
    int changes = walk->oneByOne ? -1 : countChanges(walk, entry);
    nameList* renamed = changes == 0 || list->uses == 1
                            ? list
                            : makeNameList(entry->tablespaceNames, entry->numTablespaces);
    if (renamed == nullptr)
        return failStage(msgNoMemoryNames);
    list->renamedBy = walk->numRenames;
    list->renamed = renamed;
    giveNames(entry, renamed);
    makeChanges(walk, entry, changes);
    return 0;
}

// Counts the renames before the target.
static size_t countRenames(const historyData* data)
{
    size_t numRenames = 0;
    for (int i = data->renameIndex; i >= 0 && i < data->backupIndex; i++)
        numRenames += isRename(&data->entries[i]);
    return numRenames;
}

// Sets all lists before the target to not renamed. Returns the length of the longest.
static size_t resetLists(const historyData* data)
{
    size_t most = 0;
    for (int i = 0; i < data->backupIndex; i++) {
        nameList* list = namesOfEntry(&data->entries[i]);
        if (list == nullptr)
            continue;
        list->renamedBy = 0;
        if (list->count > most)
            most = list->count;
    }
    return most;
}

// Allocates a walk over lists of so many names at most, in one block that starts with
// walk->renames. False: no memory.
static bool initWalk(renameWalk* walk, size_t numRenames, size_t mostNames)
{
    static_assert(sizeof(slotEffect) <= sizeof(nameChange));
    *walk = {};
    if (numRenames > INT_MAX / 2)
        return false;
    walk->renames =
        static_cast<nameChange*>(calloc(3 * numRenames + mostNames, sizeof(nameChange)));
    if (walk->renames == nullptr)
        return false;
    walk->effects = walk->renames + numRenames;
    walk->buckets = 2 * numRenames;
    walk->slots = reinterpret_cast<slotEffect*>(walk->effects + walk->buckets);
    return true;
}

int updateHistoryEntriesforRename(historyData* data)
{
    size_t numRenames = countRenames(data);
    if (numRenames == 0)
        return 0;

    renameWalk walk;
    if (!initWalk(&walk, numRenames, resetLists(data)))
        return failStage(msgNoMemoryImages);
    int rc = 0;
    for (int i = data->backupIndex - 1; i >= 0 && rc == 0; i--) {
        historyEntry* entry = &data->entries[i];
        if (i >= data->renameIndex && isRename(entry))
            addRename(&walk, entry);
        if (walk.numRenames > 0)
            rc = renameInEntry(&walk, entry);
    }
    free(walk.renames);
    return rc;
}
