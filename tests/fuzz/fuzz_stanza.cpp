// Any bytes go into the stanza reader. What it takes, written out and read again, must come out the
// same: nothing of an entry is lost on the way.
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "admin/stanza.h"

// Writes all records as stanzas; *text is the caller's to free.
static void writeAll(const historyList* list, char** text, size_t* length)
{
    FILE* out = open_memstream(text, length);
    for (size_t i = 0; i < list->count; i++)
        writeStanza(out, list->records[i]);
    fclose(out);
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size)
{
    historyList first = {}, second = {};
    stanzaMistake mistake;
    if (readStanzas(reinterpret_cast<const char*>(bytes), size, 0, &first, &mistake) == 0) {
        char *text, *again;
        size_t length, againLength;
        writeAll(&first, &text, &length);
        if (readStanzas(text, length, 0, &second, &mistake) != 0)
            abort();
        writeAll(&second, &again, &againLength);
        if (length != againLength || memcmp(text, again, length) != 0)
            abort();
        free(text);
        free(again);
    }
    freeList(&first);
    freeList(&second);
    return 0;
}
