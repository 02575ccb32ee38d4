// The engine's control block. The pointer is valid from the moment the library is mapped; the node
// number is there before main.
#include "sqo/sqlzkrcb.h"

#include <cstdlib>

static SQLZ_KRCB controlBlock = {0};

__attribute__((visibility("default"))) SQLZ_KRCB* sqlz_krcbp = &controlBlock;

// ZQ3NODE is a decimal number of 16 bits, with or without a sign; anything else counts as unset.
__attribute__((constructor)) static void setNodeNumber()
{
    const char* value = getenv("ZQ3NODE");
    if (value == nullptr || *value == '\0')
        return;
    char* end;
    const long number = strtol(value, &end, 10);
    if (*end == '\0' && number >= INT16_MIN && number <= UINT16_MAX)
        controlBlock.nodeNumber = static_cast<int16_t>(number);
}
