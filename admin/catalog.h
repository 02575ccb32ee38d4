// The entries of a history that matter for restores, and what a restore to one image needs.
#pragma once

#include "admin/json.h"
#include "admin/zq3hist.h"
#include "tool/zq3ckrst.h"

// What the history holds of a kept entry beside what the planner keeps of it.
struct entryFacts {
    int numGaps; // in the entry numbers up to it
    bool inactive;
};

// Entry numbers that no entry has, between those of two that follow each other.
struct numberGap {
    uint32_t first, last;
};

// An image that no plan uses.
struct unusedImage {
    historyEntry image;
    int32_t sqlcode;
    char status;
};

struct imageCatalog {
    historyData history; // every entry that matters, by time
    entryFacts* facts;   // by their index
    numberGap* gaps;     // oldest first
    int numGaps;
    unusedImage* unused; // by time
    int numUnused;
    uint32_t numEntries;                 // of the history, those that do not matter included
    bool renamesCount;                   // the planner looks at renames
    bool isCut;                          // it ends before the last entry that its header counts
    char (*onHand)[timestampLength + 1]; // the images that are there, sorted; null: all are
    size_t numOnHand;
};

// Reads the history and, unless have is null, the list of the images on hand ("-": from standard
// input). Complains on failure and returns an exit status, else 0. freeCatalog accepts what a
// failed call left.
int readCatalog(const historyPlace* place, const char* have, imageCatalog* catalog);

// Makes the catalog of a history that was read, which it releases.
int fillCatalog(const historyPlace* place, SQLUH_COMMITTED* history, const char* have,
                imageCatalog* catalog);
void freeCatalog(imageCatalog* catalog);

bool isImage(const historyEntry* entry);
bool isOnHand(const imageCatalog* catalog, const historyEntry* image);
const char* kindOfImage(const historyEntry* image);  // full, incremental, delta
const char* scopeOfImage(const historyEntry* image); // database, tablespace

// The position of the image that the planner takes for the timestamp, or of the newest one; -1:
// none.
int findImage(const imageCatalog* catalog, const char* timestamp);
int newestImage(const imageCatalog* catalog);

// Complains that there is none, or that it is one which no plan uses, and returns exitNoImage.
int failNoImage(const historyPlace* place, const imageCatalog* catalog, const char* timestamp);

// The first gap in the entry numbers after the oldest and before the newest position; null: none.
const numberGap* gapBetween(const imageCatalog* catalog, int oldest, int newest);

// Writes "entry 5" or "entries 5 to 6".
enum : unsigned int { gapCapacity = 40 };
void describeGap(const numberGap* gap, char* text);

// Writes what is missing: "a full image" for null, else the image with the timestamp, or the one
// that a restore used without naming it, for an empty one. Bytes are as they are in the history.
enum : unsigned int { lackCapacity = 64 };
void describeLack(const char* image, char* text);

// Put the members of an image's object, one of a list of what tablespaces lack, and the gap
// (images.cpp).
void putJsonImage(jsonWriter* json, const historyEntry* image);
void putJsonLack(jsonWriter* json, const char* tablespace, const char* image);
void putJsonGap(jsonWriter* json, const numberGap* gap);

// What a restore to one image needs, found with the planner's stages, so that its plans and this
// cannot differ. A row is an image up to the target, a column a tablespace.
struct imagePlan {
    restorePlan stages;        // its entries are the catalog's; its matrix is pruned
    const historyEntry** rows; // the images of the matrix's rows
    int numImages;             // that are needed, the target included
    int numIncomplete;         // tablespaces that lack an image
};

// Plans a restore to the image at a position of the catalog, whose older entries get the names of
// that time. names: the tablespaces, upper-cased, which the image holds; none: all of it. Returns
// 0, or exitFailed after a complaint. freeImagePlan accepts a zero-filled record.
int planImage(imageCatalog* catalog, int target, char** names, int numNames, imagePlan* plan);
void freeImagePlan(imagePlan* plan);

// Calls about a plan's cells.
char cellAt(const imagePlan* plan, int row, int column);
int countNeeded(const imagePlan* plan, int row); // tablespaces needed from the image
bool isNeeded(const imagePlan* plan, int row);   // whether the plan holds the image

// What a column lacks.
enum planLack { planLacksNothing, planLacksFullImage, planLacksRestored, planLacksOnHand };

// What is missing for a tablespace; *image receives the timestamp of the image, or null where that
// is any full image.
planLack lackOfColumn(const imageCatalog* catalog, const imagePlan* plan, int column,
                      const char** image);
