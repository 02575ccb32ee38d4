// What all stages share: lists of names, the failure, the release of a plan.
#include <cstdlib>
#include <cstring>

#include "tool/zq3ckrst.h"

planFailure lastFailure = {};

int failStage(const planMessage& message, const char* argument)
{
    lastFailure = {&message, argument, 0};
    return message.code;
}

int failScan(const planMessage& message, int sqlcode)
{
    lastFailure = {&message, "", sqlcode};
    return message.code;
}

nameList* makeNameList(const char (*names)[nameSize], uint32_t count)
{
    // The names themselves were allocated, too, and the record is smaller than what is left.
    size_t size = static_cast<size_t>(count) * nameSize;
    auto list = static_cast<nameList*>(malloc(sizeof(nameList) + size));
    if (list == nullptr)
        return nullptr;
    *list = {0, count, 0, nullptr};
    memcpy(list + 1, names, size);
    return list;
}

nameList* namesOfEntry(const historyEntry* entry)
{
    return entry->tablespaceNames == nullptr
               ? nullptr
               : reinterpret_cast<nameList*>(entry->tablespaceNames) - 1;
}

void giveNames(historyEntry* entry, nameList* list)
{
    nameList* former = namesOfEntry(entry);
    if (list != nullptr)
        list->uses++;
    if (former != nullptr && --former->uses == 0)
        free(former);
    entry->tablespaceNames =
        list == nullptr ? nullptr : reinterpret_cast<char(*)[nameSize]>(list + 1);
}

void freePlan(restorePlan* plan)
{
    for (int i = 0; i < plan->histData.numEntries; i++)
        giveNames(&plan->histData.entries[i], nullptr);
    free(plan->histData.entries);
    free(plan->matrix);
    free(plan->images);
    free(plan->list);
    free(plan->selected);
    *plan = {};
}
