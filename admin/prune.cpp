// zq3hist prune: removes the oldest entries, as far as no image that stays needs them.
#include <cstring>
#include <sys/stat.h>
#include <unistd.h>

#include "admin/chains.h"
#include "admin/pair.h"

struct prunePlan {
    char from[timestampWidth + 1];   // the entries before it go
    char needer[timestampWidth + 1]; // what needs an entry that is older than the time asked for
    bool keepRenames;
};

static void moveBack(prunePlan* plan, const char* from, const char* needer)
{
    if (strcmp(from, plan->from) >= 0)
        return;
    snprintf(plan->from, sizeof plan->from, "%s", from);
    snprintf(plan->needer, sizeof plan->needer, "%s", needer);
}

// The newest state stays, however old it is: that of the newest image that can be restored, and of
// the tablespaces that the next images will hold.
static void keepNewest(const chainWalk* walk, prunePlan* plan)
{
    const historyEntry* entries = walk->history->entries;
    int newest = walk->newestComplete;
    if (newest >= 0)
        moveBack(plan, entries[newest].timestamp, entries[newest].timestamp);
    for (int i = 0; i < walk->numTablespaces; i++)
        if (isAlive(walk, i)) {
            const char* image = entries[walk->links[walk->tablespaces[i].head].image].timestamp;
            moveBack(plan, image, image);
        }
}

// Images that stay must keep what they need, and restores that stay the image that they used, on
// which the next image builds. Each may move the beginning back, for those older ones, too, that
// stay because of it.
static void keepNeeded(const imageCatalog* catalog, const chainWalk* walk, prunePlan* plan)
{
    const historyEntry* entries = catalog->history.entries;
    for (int i = catalog->history.numEntries - 1; i >= 0; i--) {
        bool isRestore = entries[i].operation == zq3OperationRestore;
        int image = isImage(&entries[i]) ? i
                    : isRestore          ? findImage(catalog, entries[i].backupId)
                                         : -1;
        if (image >= 0 && strcmp(entries[i].timestamp, plan->from) >= 0)
            moveBack(plan, entries[walk->images[image].oldest].timestamp, entries[i].timestamp);
    }
}

// The planner heeds no rename if the first one is older than all images. So a rename must not come
// to stand first, and one that stands there must stay.
static void keepRenames(const imageCatalog* catalog, prunePlan* plan)
{
    const historyEntry* entries = catalog->history.entries;
    plan->keepRenames = !catalog->renamesCount;
    for (int i = 0; i < catalog->history.numEntries; i++)
        if (isImage(&entries[i]) && strcmp(entries[i].timestamp, plan->from) >= 0) {
            snprintf(plan->from, sizeof plan->from, "%s", entries[i].timestamp);
            return;
        }
}

static int findBeginning(historyPlace* place, const char* before, prunePlan* plan)
{
    imageCatalog catalog = {};
    chainWalk walk = {};
    int rc = readCatalog(place, nullptr, &catalog);
    if (rc == 0 && catalog.isCut) // whatever stays may need what is missing
        rc = failInPlace(HISTORY_FILE_DAMAGED, "prune the history", place);
    if (rc == 0)
        rc = walkChains(&catalog, catalog.history.numEntries - 1, &walk);
    snprintf(plan->from, sizeof plan->from, "%s", before);
    if (rc == 0) {
        keepNewest(&walk, plan);
        keepNeeded(&catalog, &walk, plan);
        keepRenames(&catalog, plan);
    }
    freeChains(&walk);
    freeCatalog(&catalog);
    return rc;
}

static bool stays(const void* context, const zq3HistoryData* entry)
{
    const prunePlan* plan = static_cast<const prunePlan*>(context);
    const char* timestamp = entry->objectPart.data;
    return strspn(timestamp, "0123456789") < timestampWidth ||
           memcmp(timestamp, plan->from, timestampWidth) >= 0 ||
           (plan->keepRenames && entry->operation == zq3OperationRename);
}

// What pruning would come to. The history was read before, and what is to be told of it was told.
static int rehearsePruning(const historyPlace* place, const prunePlan* plan, partReport* part)
{
    entryRoom room;
    SQLUH_COMMITTED* committed = nullptr;
    int code = sqluhReadCommitted(place->directory, &committed);
    prepareRoom(&room);
    if (code >= 0 && committed->failure != 0)
        code = committed->failure;
    for (uint32_t row = 0; code >= 0 && row < committed->numRows; row++) {
        sqluhGetCommitted(committed, row, &room.entry, false);
        part->total++;
        part->kept += stays(plan, &room.data);
    }
    sqluhFreeCommitted(&committed);
    return code >= 0 ? 0 : failInPlace(code, "prune the history", place);
}

static void tellPart(const prunePlan* plan, const partReport* part, bool dryRun)
{
    const char* would = dryRun ? "would be " : "";
    printf("%u of %u entries %sremoved, those before %s; %u %s\n", part->total - part->kept,
           part->total, would, plan->from, part->kept, dryRun ? "would stay" : "stay");
    if (plan->needer[0] != '\0')
        printf("The entries from %s on stay because %s needs them\n", plan->from, plan->needer);
}

// What the plan was made from must be what is pruned.
static bool isUnchanged(const struct stat* before, const struct stat* after)
{
    return before->st_ino == after->st_ino && before->st_size == after->st_size &&
           before->st_ctim.tv_sec == after->st_ctim.tv_sec &&
           before->st_ctim.tv_nsec == after->st_ctim.tv_nsec;
}

static int prunePair(historyPlace* place, SQLUH_HANDLE* handle, const struct stat* planned,
                     const prunePlan* plan, char* temporary)
{
    struct stat there = {};
    pairFinding pair;
    partReport part = {};
    keptFiles kept = {};
    int rc = examinePair(place, true, &pair);
    if (rc == 0 && pair.due != sqluhRepairNone)
        return failPair(place, &pair, "prune the history");
    if (rc == 0 && (stat(place->historyPath, &there) != 0 || !isUnchanged(planned, &there)))
        return fail(place->directory, "the history changed meanwhile; prune it again");
    int code = rc == 0 ? writePart(place->historyPath, stays, plan, temporary, &part) : 0;
    if (code != 0)
        rc = failWithCode(code, "write the new history", place->directory);
    bool change = rc == 0 && part.kept < part.total;
    if (change)
        rc = keepPair(handle, &kept);
    if (change && rc == 0)
        rc = replacePair(place, handle, temporary);
    if (rc == 0)
        tellPart(plan, &part, false);
    tellKept(&kept);
    return rc;
}

int pruneMain(commandLine* line)
{
    historyPlace* place = &line->place;
    prunePlan plan = {};
    struct stat planned = {};
    char temporary[pathCapacity];
    SQLUH_HANDLE* handle = nullptr;
    if (line->before[0] == '\0')
        return failUsage("prune takes --before TIMESTAMP");
    stat(place->historyPath, &planned);
    int rc = formTemporary(place->historyPath, temporary);
    if (rc == 0)
        rc = checkLock(place, R_OK | W_OK);
    if (rc == 0)
        rc = findBeginning(place, line->before, &plan);
    if (rc == 0 && line->dryRun) {
        partReport part = {};
        rc = rehearsePruning(place, &plan, &part);
        if (rc == 0)
            tellPart(&plan, &part, true);
        return rc;
    }
    if (rc == 0)
        rc = lockPair(place, R_OK | W_OK, &handle);
    if (rc == 0) {
        rc = prunePair(place, handle, &planned, &plan, temporary);
        unlink(temporary);
    }
    return unlockPair(place, &handle, rc);
}
