// The walk over all chains.
#include "admin/chains.h"

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "tool/nameindex.h"
#include "zq3.h"

// A name that the history holds, and the tablespace that it stands for now.
struct chainName {
    char name[nameSize];
    nameLinks links;
    int number;
};

// What the walk needs beside what it leaves.
struct chainWalker {
    const imageCatalog* catalog;
    chainWalk* walk;
    chainName* names;
    size_t numNames, nameCapacity;
    int tablespaceCapacity;
    int* countedFor; // by position: the image that it was counted for last
};

// --- Tablespaces and their names -----------------------------------------------------------------

static bool growNames(chainWalker* walker)
{
    size_t capacity = walker->nameCapacity * 2 + 64;
    void* grown = reallocarray(walker->names, capacity, sizeof *walker->names);
    if (grown == nullptr)
        return false;
    walker->names = static_cast<chainName*>(grown);
    walker->nameCapacity = capacity;
    enterNames(walker->names, capacity, walker->numNames);
    return true;
}

// The number of a new tablespace of that name, or -1 for want of memory.
static int trackTablespace(chainWalker* walker, const char* name)
{
    chainWalk* walk = walker->walk;
    if (walk->numTablespaces == walker->tablespaceCapacity) {
        int capacity = walker->tablespaceCapacity * 2 + 64;
        void* grown = reallocarray(walk->tablespaces, static_cast<size_t>(capacity),
                                   sizeof *walk->tablespaces);
        if (grown == nullptr)
            return -1;
        walk->tablespaces = static_cast<chainTablespace*>(grown);
        walker->tablespaceCapacity = capacity;
    }
    chainTablespace* added = &walk->tablespaces[walk->numTablespaces];
    copyName(added->name, name);
    added->head = lacksFullImage;
    return walk->numTablespaces++;
}

// What the walk knows of a name; one that is new stands for a new tablespace. Null: no memory. It
// is valid until the next call.
static chainName* takeName(chainWalker* walker, const char* name)
{
    int found = walker->numNames == 0 ? -1 : findName(walker->names, walker->nameCapacity, name);
    if (found >= 0)
        return &walker->names[found];
    if (walker->numNames == walker->nameCapacity && !growNames(walker))
        return nullptr;
    chainName* added = &walker->names[walker->numNames];
    copyName(added->name, name);
    added->number = trackTablespace(walker, name);
    if (added->number < 0)
        return nullptr;
    enterName(walker->names, walker->nameCapacity, walker->numNames++);
    return added;
}

static int numberOf(chainWalker* walker, const char* name)
{
    const chainName* taken = takeName(walker, name);
    return taken != nullptr ? taken->number : -1;
}

// --- Entries -------------------------------------------------------------------------------------

static int takeImage(chainWalker* walker, int position)
{
    chainWalk* walk = walker->walk;
    const historyEntry* entry = &walk->history->entries[position];
    imageChains* image = &walk->images[position];
    image->firstLink = walk->numLinks;
    for (uint32_t i = 0; i < entry->numTablespaces; i++) {
        int number = numberOf(walker, entry->tablespaceNames[i]);
        if (number < 0 || walk->links == nullptr)
            return -1;
        int* head = &walk->tablespaces[number].head;
        const chainLink* parent = *head >= 0 ? &walk->links[*head] : nullptr;
        if (parent != nullptr && parent->image == position)
            continue; // the name stands there twice
        chainLink* link = &walk->links[walk->numLinks];
        *link = {position,
                 number,
                 static_cast<int>(i),
                 *head,
                 parent != nullptr ? parent->full : *head,
                 lacksNothing};
        if (sqluhIsHistEntryIncr(entry->operationType))
            link->lack = link->full >= 0 ? walk->links[link->full].lack : link->full;
        else if (sqluhIsHistEntryDelta(entry->operationType))
            link->lack = parent != nullptr ? parent->lack : *head;
        else
            link->full = walk->numLinks;
        if (!isOnHand(walker->catalog, entry))
            link->lack = 1 + position;
        *head = walk->numLinks++;
    }
    image->numLinks = walk->numLinks - image->firstLink;
    return 0;
}

// The place of a tablespace's version in the image that a restore used.
static int findRestored(const chainWalk* walk, int restore, int number)
{
    const historyEntry* entries = walk->history->entries;
    int low = 0, high = restore; // the first entry later than the image
    while (low < high) {
        int middle = low + (high - low) / 2;
        if (memcmp(entries[middle].timestamp, entries[restore].backupId, timestampLength) <= 0)
            low = middle + 1;
        else
            high = middle;
    }
    while (--low >= 0 &&
           memcmp(entries[low].timestamp, entries[restore].backupId, timestampLength) == 0)
        for (int i = 0; i < walk->images[low].numLinks; i++)
            if (walk->links[walk->images[low].firstLink + i].tablespace == number)
                return walk->images[low].firstLink + i;
    return lacksRestored - restore;
}

// A restore, or the creation of tablespaces.
static int takeEvent(chainWalker* walker, int position)
{
    chainWalk* walk = walker->walk;
    const historyEntry* entry = &walk->history->entries[position];
    for (uint32_t i = 0; i < entry->numTablespaces; i++) {
        int number = numberOf(walker, entry->tablespaceNames[i]);
        if (number < 0)
            return -1;
        walk->tablespaces[number].head = entry->operation == zq3OperationRestore
                                             ? findRestored(walk, position, number)
                                             : lacksFullImage;
    }
    return 0;
}

// The tablespace goes on under its new name; who bore that before is out of reach, and the old name
// is free for another.
static int takeRename(chainWalker* walker, const historyEntry* entry)
{
    if (entry->numTablespaces < 2)
        return 0;
    const char* oldName = entry->tablespaceNames[0];
    const char* newName = entry->tablespaceNames[1];
    int renamed = numberOf(walker, oldName);
    int replaced = numberOf(walker, newName);
    int fresh = trackTablespace(walker, oldName);
    if (renamed < 0 || replaced < 0 || fresh < 0)
        return -1;
    chainTablespace* tablespaces = walker->walk->tablespaces;
    copyName(tablespaces[renamed].name, newName);
    tablespaces[replaced].name[0] = '\0';        // also of one that is renamed to itself
    takeName(walker, newName)->number = renamed; // both are known by now
    takeName(walker, oldName)->number = fresh;
    return 0;
}

// --- What an image needs -------------------------------------------------------------------------

int nextNeeded(const chainWalk* walk, int link)
{
    const chainLink* at = &walk->links[link];
    if (at->full == link)
        return lacksFullImage;
    char type = walk->history->entries[at->image].operationType;
    return sqluhIsHistEntryIncr(type) ? at->full : at->parent;
}

// The one image that all chains of an image go on to, and that holds nothing else; -1: there is
// none.
static int commonNext(const chainWalk* walk, const imageChains* image)
{
    int common = -1;
    for (int i = 0; i < image->numLinks; i++) {
        int next = nextNeeded(walk, image->firstLink + i);
        if (next < 0 || (common >= 0 && walk->links[next].image != common))
            return -1;
        common = walk->links[next].image;
    }
    return common >= 0 && walk->images[common].numLinks == image->numLinks ? common : -1;
}

static void countNeeds(chainWalker* walker, int position)
{
    chainWalk* walk = walker->walk;
    imageChains* image = &walk->images[position];
    int common = commonNext(walk, image);
    image->oldest = position;
    for (int i = 0; i < image->numLinks; i++)
        image->numIncomplete += walk->links[image->firstLink + i].lack != lacksNothing;
    if (common >= 0) {
        image->numImages = walk->images[common].numImages + 1;
        image->oldest = walk->images[common].oldest;
        return;
    }
    for (int i = 0; i < image->numLinks; i++)
        for (int at = image->firstLink + i; at >= 0; at = nextNeeded(walk, at)) {
            int needed = walk->links[at].image;
            image->numImages += walker->countedFor[needed] != position;
            walker->countedFor[needed] = position;
            image->oldest = needed < image->oldest ? needed : image->oldest;
        }
}

// Adds up the images; those without tablespaces, which the planner puts into every plan, among
// them.
static void countImages(chainWalk* walk, int last)
{
    int numEmpty = 0;
    walk->newestComplete = -1;
    for (int i = 0; i <= last; i++) {
        imageChains* image = &walk->images[i];
        if (!isImage(&walk->history->entries[i]))
            continue;
        numEmpty += image->numLinks == 0;
        image->numImages += numEmpty;
        walk->numImages++;
        walk->numIncomplete += image->numIncomplete != 0;
        if (image->numIncomplete == 0)
            walk->newestComplete = i;
        if (walk->history->entries[i].object != zq3ObjectTablespace)
            walk->newestWhole = i;
    }
}

// --- The walk ------------------------------------------------------------------------------------

static bool allocateWalk(chainWalker* walker, int last)
{
    const historyData* history = &walker->catalog->history;
    size_t numLinks = 1, numEntries = static_cast<size_t>(history->numEntries) + 1;
    for (int i = 0; i <= last; i++)
        numLinks += isImage(&history->entries[i]) ? history->entries[i].numTablespaces : 0;
    if (numLinks > INT_MAX)
        return false;
    walker->walk->links =
        static_cast<chainLink*>(reallocarray(nullptr, numLinks, sizeof(chainLink)));
    walker->walk->images = static_cast<imageChains*>(calloc(numEntries, sizeof(imageChains)));
    walker->countedFor = static_cast<int*>(malloc(numEntries * sizeof(int)));
    if (walker->walk->links == nullptr || walker->walk->images == nullptr ||
        walker->countedFor == nullptr)
        return false;
    memset(walker->countedFor, -1, numEntries * sizeof(int));
    return true;
}

static int takeEntry(chainWalker* walker, int position)
{
    const historyEntry* entry = &walker->walk->history->entries[position];
    int rc = 0;
    if (isImage(entry)) {
        rc = takeImage(walker, position);
        countNeeds(walker, position);
    } else if (entry->operation == zq3OperationRestore || entry->operation == zq3OperationCreate) {
        rc = takeEvent(walker, position);
    } else if (entry->operation == zq3OperationRename && walker->catalog->renamesCount) {
        rc = takeRename(walker, entry);
    }
    return rc;
}

int walkChains(const imageCatalog* catalog, int last, chainWalk* walk)
{
    chainWalker walker = {};
    walker.catalog = catalog;
    walker.walk = walk;
    *walk = {};
    walk->history = &catalog->history;
    int rc = allocateWalk(&walker, last) ? 0 : -1;
    for (int i = 0; rc == 0 && i <= last; i++)
        rc = takeEntry(&walker, i);
    if (rc == 0)
        countImages(walk, last);
    free(walker.names);
    free(walker.countedFor);
    return rc == 0 ? 0 : failWithCode(sqloSystemError | ENOMEM, "plan", "all images");
}

void freeChains(chainWalk* walk)
{
    free(walk->links);
    free(walk->images);
    free(walk->tablespaces);
    *walk = {};
}

bool isAlive(const chainWalk* walk, int tablespace)
{
    const chainTablespace* asked = &walk->tablespaces[tablespace];
    return asked->name[0] != '\0' && asked->head >= 0 &&
           walk->links[asked->head].image >= walk->newestWhole;
}

const char* lackingImage(const chainWalk* walk, const chainLink* link)
{
    const historyEntry* entries = walk->history->entries;
    if (link->lack > lacksNothing)
        return entries[link->lack - 1].timestamp;
    return link->lack == lacksFullImage ? nullptr : entries[lacksRestored - link->lack].backupId;
}
