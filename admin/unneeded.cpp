// zq3hist unneeded and needed-by: which images may go, and which restores would break.
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "admin/chains.h"
#include "admin/json.h"

// Images are marked one after the other.
struct markedImages {
    imageCatalog catalog;
    chainWalk walk;
    bool* links; // by link
    bool* marks; // by position
};

static int readMarked(commandLine* line, markedImages* marked)
{
    int rc = readCatalog(&line->place, nullptr, &marked->catalog);
    int numEntries = marked->catalog.history.numEntries;
    if (rc == 0)
        rc = walkChains(&marked->catalog, numEntries - 1, &marked->walk);
    if (rc != 0)
        return rc;
    marked->links = static_cast<bool*>(calloc(static_cast<size_t>(marked->walk.numLinks) + 1, 1));
    marked->marks = static_cast<bool*>(calloc(static_cast<size_t>(numEntries) + 1, 1));
    return marked->links != nullptr && marked->marks != nullptr
               ? 0
               : failWithCode(sqloSystemError | ENOMEM, "mark the images", line->place.directory);
}

static void freeMarked(markedImages* marked)
{
    free(marked->links);
    free(marked->marks);
    freeChains(&marked->walk);
    freeCatalog(&marked->catalog);
}

// Prints the images that are marked as said, and how many they are.
static void showMarked(markedImages* marked, const commandLine* line, bool mark, const char* key,
                       const char* value, const char* summary)
{
    jsonWriter json = {};
    int count = 0;
    if (line->json) {
        beginAnswer(&json);
        putJsonText(&json, key, value);
        beginJson(&json, "images", '[');
    }
    for (int i = 0; i < marked->catalog.history.numEntries; i++) {
        const historyEntry* image = &marked->catalog.history.entries[i];
        if (!isImage(image) || marked->marks[i] != mark)
            continue;
        count++;
        if (line->json) {
            beginJson(&json, nullptr, '{');
            putJsonImage(&json, image);
            endJson(&json, '}');
        } else {
            putEscaped(stdout, image->timestamp, strlen(image->timestamp));
            printf("  %-11s  %s\n", kindOfImage(image), scopeOfImage(image));
        }
    }
    if (line->json) {
        endJson(&json, ']');
        putJsonNumber(&json, "imageCount", marked->walk.numImages);
        endJsonLine(&json);
    } else {
        printf("%d of %d images%s%s\n", count, marked->walk.numImages, summary, value);
    }
}

static bool isSameImage(const markedImages* marked, int a, int b)
{
    const historyEntry* entries = marked->catalog.history.entries;
    return strcmp(entries[a].timestamp, entries[b].timestamp) == 0;
}

// A history may list an image more than once: whoever needs one of the entries needs the image.
static void shareMarks(markedImages* marked)
{
    int count = marked->catalog.history.numEntries;
    for (int first = 0, end = 0; first < count; first = end) {
        bool any = false;
        for (end = first; end < count && isSameImage(marked, first, end); end++)
            any = any || marked->marks[end];
        memset(marked->marks + first, any, static_cast<size_t>(end - first));
    }
}

// Marks what the restores to images from that time on need, and those images themselves. The next
// image is one of them: what it will be taken on top of is needed, too. False: no image is there.
static bool markNeeded(markedImages* marked, const char* since)
{
    const chainWalk* walk = &marked->walk;
    bool any = false;
    for (int i = 0; i < walk->numTablespaces; i++)
        if (isAlive(walk, i))
            marked->links[walk->tablespaces[i].head] = true;
    for (int i = marked->catalog.history.numEntries - 1; i >= 0; i--) {
        const historyEntry* image = &marked->catalog.history.entries[i];
        const imageChains* chains = &walk->images[i];
        if (!isImage(image))
            continue;
        bool isTarget = strcmp(image->timestamp, since) >= 0;
        any = any || isTarget;
        if (isTarget || (any && chains->numLinks == 0)) // those are in every plan
            marked->marks[i] = true;
        for (int link = chains->firstLink; link < chains->firstLink + chains->numLinks; link++) {
            marked->links[link] = marked->links[link] || isTarget;
            int next = nextNeeded(walk, link);
            if (!marked->links[link])
                continue;
            marked->marks[i] = true;
            if (next >= 0)
                marked->links[next] = true;
        }
    }
    shareMarks(marked);
    return any;
}

// The timestamp of the oldest of the newest images that can be restored, so many as are to be kept;
// that of the oldest image when there are fewer. Null: none can be restored.
static const char* oldestKept(const markedImages* marked, long keep)
{
    const char* since = nullptr;
    for (int i = marked->walk.newestComplete; i >= 0 && keep > 0; i--) {
        const historyEntry* image = &marked->catalog.history.entries[i];
        if (!isImage(image) || marked->walk.images[i].numIncomplete != 0)
            continue;
        since = image->timestamp;
        keep--;
    }
    for (int i = 0; since != nullptr && keep > 0; i++)
        if (isImage(&marked->catalog.history.entries[i]))
            return marked->catalog.history.entries[i].timestamp;
    return since;
}

int unneededMain(commandLine* line)
{
    if ((line->since[0] == '\0') == (line->keep < 0) || line->keep == 0)
        return failUsage("unneeded takes --since TIMESTAMP or --keep N, N at least 1");
    markedImages marked = {};
    const char* since = line->since;
    int rc = readMarked(line, &marked);
    if (rc == 0 && marked.catalog.isCut) {
        fail(line->place.directory, "what the entries need that are missing cannot be told");
        rc = exitDamaged;
    }
    if (rc == 0 && line->keep > 0)
        since = oldestKept(&marked, line->keep);
    if (rc == 0 && (since == nullptr || !markNeeded(&marked, since))) {
        // Nothing then needs anything, which says nothing about what may go.
        fail(line->place.directory, "no image %s%s",
             since == nullptr ? "can be restored" : "is there from then on: ",
             since == nullptr ? "" : since);
        rc = exitNoImage;
    }
    if (rc == 0)
        showMarked(&marked, line, false, "since", since, " are not needed by restores from ");
    freeMarked(&marked);
    return rc;
}

// Marks the images that can be restored, and not without the one whose first entry is at the
// position.
static void markNeeders(markedImages* marked, int position)
{
    const chainWalk* walk = &marked->walk;
    bool inAll = false;
    for (int i = position; i < marked->catalog.history.numEntries; i++) {
        const imageChains* chains = &walk->images[i];
        bool isImageEntry = isImage(&marked->catalog.history.entries[i]);
        bool isNeeded = isImageEntry && isSameImage(marked, i, position);
        inAll = inAll || (isNeeded && chains->numLinks == 0);
        bool needs = inAll;
        for (int link = chains->firstLink; link < chains->firstLink + chains->numLinks; link++) {
            int next = nextNeeded(walk, link);
            marked->links[link] = isNeeded || (next >= 0 && marked->links[next]);
            needs = needs || marked->links[link];
        }
        if (isImageEntry && !isNeeded && needs && chains->numIncomplete == 0)
            marked->marks[i] = true;
    }
}

int neededByMain(commandLine* line)
{
    markedImages marked = {};
    char timestamp[timestampLength + 1];
    int rc = takeInstant("needed-by", line->arguments[0], timestamp);
    if (rc == 0)
        rc = readMarked(line, &marked);
    int position = rc == 0 ? findImage(&marked.catalog, timestamp) : -1;
    if (rc == 0 && position < 0)
        rc = failNoImage(&line->place, &marked.catalog, timestamp);
    if (rc == 0) {
        markNeeders(&marked, position);
        showMarked(&marked, line, true, "image", timestamp, " need ");
    }
    freeMarked(&marked);
    return rc;
}
