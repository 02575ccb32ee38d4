// zq3hist images: every backup image, and whether a restore to it is possible.
#include "admin/catalog.h"

#include <cstring>

#include "admin/json.h"

static void showMissing(const imagePlan* plan)
{
    const char* separator = "incomplete: ";
    for (int column = 0; column < plan->stages.numTablespaces; column++) {
        const char* image;
        if (isChainComplete(plan, column, &image))
            continue;
        const char* name = plan->stages.list[column].name;
        fputs(separator, stdout);
        putEscaped(stdout, name, strlen(name));
        fputs(image == nullptr ? " lacks a full image" : " lacks the image ", stdout);
        if (image != nullptr)
            putEscaped(stdout, image, strlen(image));
        separator = ", ";
    }
    putchar('\n');
}

void putJsonMissing(const imagePlan* plan)
{
    bool first = true;
    fputs("\"missing\":[", stdout);
    for (int column = 0; column < plan->stages.numTablespaces; column++) {
        const char* image;
        if (isChainComplete(plan, column, &image))
            continue;
        const char* name = plan->stages.list[column].name;
        fputs(first ? "{\"tablespace\":" : ",{\"tablespace\":", stdout);
        putJsonText(stdout, name, strlen(name));
        fputs(",\"image\":", stdout);
        if (image != nullptr)
            putJsonText(stdout, image, strlen(image));
        else
            fputs("null", stdout);
        putchar('}');
        first = false;
    }
    putchar(']');
}

static void showImage(const historyEntry* image, const imagePlan* plan)
{
    putEscaped(stdout, image->timestamp, strlen(image->timestamp));
    printf("%*s%-11s  %-10s  %4u tablespace%s  %4d image%s  ",
           static_cast<int>(timestampLength - strlen(image->timestamp)) + 2, "", kindOfImage(image),
           scopeOfImage(image), image->numTablespaces, image->numTablespaces == 1 ? " " : "s",
           plan->numImages, plan->numImages == 1 ? " " : "s");
    if (plan->numIncomplete == 0)
        puts("complete");
    else
        showMissing(plan);
}

static void showJsonImage(const historyEntry* image, const imagePlan* plan)
{
    fputs("{\"timestamp\":", stdout);
    putJsonText(stdout, image->timestamp, strlen(image->timestamp));
    printf(",\"kind\":\"%s\",\"scope\":\"%s\",\"tablespaces\":%u,\"images\":%d,\"complete\":%s,",
           kindOfImage(image), scopeOfImage(image), image->numTablespaces, plan->numImages,
           plan->numIncomplete == 0 ? "true" : "false");
    putJsonMissing(plan);
    puts("}");
}

int imagesMain(commandLine* line)
{
    imageCatalog catalog = {};
    const planScope scope = {nullptr, 0, false};
    int rc = readCatalog(&line->place, &catalog);
    for (int i = 0; rc == 0 && i < catalog.history.numEntries; i++) {
        const historyEntry* image = &catalog.history.entries[i];
        imagePlan plan = {};
        if (!isImage(image))
            continue;
        rc = planImage(&catalog, i, &scope, &plan);
        if (rc == 0 && line->json)
            showJsonImage(image, &plan);
        else if (rc == 0)
            showImage(image, &plan);
        freeImagePlan(&plan);
    }
    freeCatalog(&catalog);
    return rc;
}
