// Any bytes go into the stanza reader. What it takes, written out and read again, must come out the
// same: nothing of an entry is lost on the way.
#include <cstdio>
#include <cstdlib>
#include <string>

#include "admin/stanza.h"
#include "memoryfile.h"

// All records as stanzas.
static std::string written(const historyList* list)
{
    char* text;
    size_t length;
    FILE* out = open_memstream(&text, &length);
    for (size_t i = 0; i < list->count; i++)
        writeStanza(out, list->records[i]);
    fclose(out);
    std::string stanzas(text, length);
    free(text);
    return stanzas;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size)
{
    historyList first = {}, second = {};
    stanzaMistake mistake;
    if (readStanzas(reinterpret_cast<const char*>(bytes), size, 0, &first, &mistake) == 0) {
        const std::string text = written(&first);
        REQUIRE(readStanzas(text.data(), text.size(), 0, &second, &mistake) == 0);
        REQUIRE(written(&second) == text);
    }
    freeList(&first);
    freeList(&second);
    return 0;
}
