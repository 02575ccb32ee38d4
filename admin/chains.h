// The chain of every tablespace at every image, found in one walk over the history.
//
// What a restore to one image needs is the planner's to say; this walk answers what concerns all
// images at once, and the two agree: see nextNeeded. (But for an image that lists a name twice,
// which none should: of the two the planner renames only the first.)
#pragma once

#include "admin/catalog.h"

// A place in a chain: a link's number or, when it is negative, why there is none: lacksFullImage,
// or lacksRestored minus the position of the restore whose image the history does not know.
enum : int { lacksFullImage = -1, lacksRestored = -2 };

// The version of a tablespace that one image holds.
struct chainLink {
    int image;      // position of the image in the history
    int tablespace; // a number that it keeps through renames
    int slot;       // among the names of the image
    int parent;     // place of the version that the image was taken on top of
    int full;       // place of the newest full version on the way back, this one included
    int lack;       // lacksNothing, why a place is none, or 1 + position of an image not on hand
};
enum : int { lacksNothing = 0 };

// An image, by its position; all 0 for other entries.
struct imageChains {
    int firstLink, numLinks; // of its tablespaces
    int numImages;           // that a restore to it needs, itself included
    int numIncomplete;       // tablespaces that lack something
    int oldest;              // position of the oldest image needed
};

// A tablespace, by its number, as it stands at the end of the walk.
struct chainTablespace {
    char name[nameSize]; // empty: another one took it
    int head;            // place of its version
};

struct chainWalk {
    const historyData* history;
    chainLink* links;
    int numLinks;
    imageChains* images; // as many as entries
    chainTablespace* tablespaces;
    int numTablespaces;
    int numImages, numIncomplete;
    int newestComplete; // position of the newest image that can be restored; -1: none
    int newestWhole;    // of the newest image of the whole database; 0 if there is none
};

// Walks from the oldest entry to that at the position last. Complains and returns exitFailed for
// want of memory, else 0. freeChains accepts what a failed walk left.
int walkChains(const imageCatalog* catalog, int last, chainWalk* walk);
void freeChains(chainWalk* walk);

// Whether the newest image of the whole database, or a later one, holds the tablespace.
bool isAlive(const chainWalk* walk, int tablespace);

// The next older place that a restore to the link needs; negative after a full version.
int nextNeeded(const chainWalk* walk, int link);

// The timestamp of the image that a link lacks; null: a full image that the history does not know.
const char* lackingImage(const chainWalk* walk, const chainLink* link);
