// zq3hist images: every backup image, and whether a restore to it is possible.
#include <cstring>

#include "admin/chains.h"
#include "admin/json.h"

// --- What is missing -----------------------------------------------------------------------------

// The names are those of the image's own time.
static const char* nameOfLink(const chainWalk* walk, const chainLink* link)
{
    return walk->history->entries[link->image].tablespaceNames[link->slot];
}

static void putLack(const chainWalk* walk, const chainLink* link, bool plural)
{
    char lack[lackCapacity];
    describeLack(lackingImage(walk, link), lack);
    fputs(plural ? " lack " : " lacks ", stdout);
    putEscaped(stdout, lack, strlen(lack));
}

static void putMissing(const chainWalk* walk, const imageChains* chains)
{
    const chainLink* links = &walk->links[chains->firstLink];
    int numAlike = 0;
    while (numAlike < chains->numLinks && links[numAlike].lack == links->lack)
        numAlike++;
    fputs("incomplete: ", stdout);
    if (numAlike == chains->numLinks && numAlike > 1) {
        printf("all %d", numAlike);
        putLack(walk, links, true);
        return;
    }
    const char* separator = "";
    for (int i = 0; i < chains->numLinks; i++) {
        if (links[i].lack == lacksNothing)
            continue;
        const char* name = nameOfLink(walk, &links[i]);
        fputs(separator, stdout);
        putEscaped(stdout, name, strlen(name));
        putLack(walk, &links[i], false);
        separator = ", ";
    }
}

void putJsonLack(jsonWriter* json, const char* tablespace, const char* image)
{
    beginJson(json, nullptr, '{');
    putJsonText(json, "tablespace", tablespace);
    putJsonText(json, "image", image);
    endJson(json, '}');
}

void putJsonGap(jsonWriter* json, const numberGap* gap)
{
    if (gap == nullptr) {
        putJsonText(json, "gap", nullptr);
        return;
    }
    beginJson(json, "gap", '{');
    putJsonNumber(json, "first", gap->first);
    putJsonNumber(json, "last", gap->last);
    endJson(json, '}');
}

void putJsonImage(jsonWriter* json, const historyEntry* image)
{
    putJsonText(json, "timestamp", image->timestamp);
    putJsonText(json, "kind", kindOfImage(image));
    putJsonText(json, "scope", scopeOfImage(image));
    putJsonNumber(json, "tablespaceCount", image->numTablespaces);
}

// --- The list ------------------------------------------------------------------------------------

// A row of the list: an image that plans use, or one that none does.
struct imageRow {
    const historyEntry* image;
    const imageChains* chains; // null: none uses it
    const numberGap* gap;
    const unusedImage* unused;
};

struct imageList {
    imageCatalog catalog;
    chainWalk walk;
    const commandLine* line;
    jsonWriter json;
    long skipped, shown;
};

static void putImageHead(void)
{
    puts("TIMESTAMP       KIND         SCOPE       TABLESPACES  IMAGES  RESTORE");
}

// Why no plan uses an image.
static void putUnused(const unusedImage* unused)
{
    if (unused->sqlcode < 0)
        printf("failed: SQLCODE %d", unused->sqlcode);
    else
        fputs("not active", stdout);
}

static void showRow(const imageList* list, const imageRow* row)
{
    const historyEntry* image = row->image;
    char gap[gapCapacity] = "";
    if (row->gap != nullptr)
        describeGap(row->gap, gap);
    putEscaped(stdout, image->timestamp, strlen(image->timestamp));
    printf("%*s%-11s  %-10s  %11u  ",
           static_cast<int>(timestampLength - strlen(image->timestamp)) + 2, "", kindOfImage(image),
           scopeOfImage(image), image->numTablespaces);
    if (row->chains == nullptr) {
        printf("%6s  ", "-");
        putUnused(row->unused);
    } else {
        printf("%6d  ", row->chains->numImages);
        if (row->chains->numIncomplete != 0)
            putMissing(&list->walk, row->chains);
        else if (row->gap != nullptr)
            printf("chain found; the history lacks %s", gap);
        else
            fputs("complete", stdout);
        if (list->line->all && list->catalog.facts[image->index].inactive)
            fputs(", inactive", stdout);
    }
    putchar('\n');
}

static void showJsonRow(imageList* list, const imageRow* row)
{
    jsonWriter* json = &list->json;
    const chainWalk* walk = &list->walk;
    beginJson(json, nullptr, '{');
    putJsonImage(json, row->image);
    putJsonBool(json, "used", row->chains != nullptr);
    if (row->chains == nullptr) {
        putJsonNumber(json, "sqlcode", row->unused->sqlcode);
        putJsonBytes(json, "status", &row->unused->status, 1);
    } else {
        putJsonNumber(json, "neededCount", row->chains->numImages);
        putJsonBool(json, "complete", row->chains->numIncomplete == 0);
        beginJson(json, "missing", '[');
        for (int i = 0; i < row->chains->numLinks; i++) {
            const chainLink* link = &walk->links[row->chains->firstLink + i];
            if (link->lack != lacksNothing)
                putJsonLack(json, nameOfLink(walk, link), lackingImage(walk, link));
        }
        endJson(json, ']');
        putJsonGap(json, row->gap);
        putJsonBool(json, "inactive", list->catalog.facts[row->image->index].inactive);
    }
    endJson(json, '}');
}

static bool isWanted(const imageList* list, const imageRow* row)
{
    return strcmp(row->image->timestamp, list->line->since) >= 0 &&
           (!list->line->incomplete || row->chains == nullptr || row->chains->numIncomplete != 0);
}

// Calls visit for each row that is wanted, oldest first.
static void visitRows(imageList* list, void (*visit)(imageList*, const imageRow*))
{
    const imageCatalog* catalog = &list->catalog;
    int numUnused = list->line->all ? catalog->numUnused : 0;
    int unused = 0;
    for (int i = 0; i <= catalog->history.numEntries; i++) {
        const historyEntry* entry =
            i < catalog->history.numEntries ? &catalog->history.entries[i] : nullptr;
        if (entry != nullptr && !isImage(entry))
            continue;
        for (; unused < numUnused &&
               (entry == nullptr || sortHistoryEntries(&catalog->unused[unused].image, entry) < 0);
             unused++) {
            imageRow row = {&catalog->unused[unused].image, nullptr, nullptr,
                            &catalog->unused[unused]};
            if (isWanted(list, &row))
                visit(list, &row);
        }
        if (entry == nullptr)
            break;
        const imageChains* chains = &list->walk.images[i];
        imageRow row = {entry, chains, gapBetween(catalog, chains->oldest, i), nullptr};
        if (isWanted(list, &row))
            visit(list, &row);
    }
}

static void countRow(imageList* list, const imageRow*)
{
    list->skipped++;
}

static void visitRow(imageList* list, const imageRow* row)
{
    if (list->skipped > 0) {
        list->skipped--;
        return;
    }
    list->shown++;
    if (list->line->json)
        showJsonRow(list, row);
    else
        showRow(list, row);
}

static void putSummary(const imageList* list)
{
    const chainWalk* walk = &list->walk;
    printf("%d image%s", walk->numImages, walk->numImages == 1 ? "" : "s");
    if (list->shown != walk->numImages)
        printf(", %ld shown", list->shown);
    printf(", %d incomplete", walk->numIncomplete);
    if (walk->newestComplete >= 0) {
        fputs("; newest that can be restored: ", stdout);
        const char* newest = walk->history->entries[walk->newestComplete].timestamp;
        putEscaped(stdout, newest, strlen(newest));
    }
    putchar('\n');
}

static void putJsonSummary(imageList* list)
{
    const chainWalk* walk = &list->walk;
    endJson(&list->json, ']');
    putJsonNumber(&list->json, "imageCount", walk->numImages);
    putJsonNumber(&list->json, "incompleteCount", walk->numIncomplete);
    putJsonText(&list->json, "newestRestorable",
                walk->newestComplete < 0 ? nullptr
                                         : walk->history->entries[walk->newestComplete].timestamp);
    endJsonLine(&list->json);
}

int imagesMain(commandLine* line)
{
    imageList list = {};
    list.line = line;
    int rc = readCatalog(&line->place, line->have, &list.catalog);
    if (rc == 0)
        rc = walkChains(&list.catalog, list.catalog.history.numEntries - 1, &list.walk);
    if (rc == 0) {
        if (line->last >= 0) {
            visitRows(&list, countRow);
            list.skipped -= line->last;
        }
        if (line->json)
            beginAnswer(&list.json);
        if (line->json)
            beginJson(&list.json, "images", '[');
        else
            putImageHead();
        visitRows(&list, visitRow);
        if (line->json)
            putJsonSummary(&list);
        else
            putSummary(&list);
    }
    freeChains(&list.walk);
    freeCatalog(&list.catalog);
    return rc;
}
