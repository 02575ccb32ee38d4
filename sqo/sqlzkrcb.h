// The engine's control block, as far as this system reads it. Declarations only; libzq3osse.so.1
// provides it.
#pragma once

#include <cstdint>

struct SQLZ_KRCB {
    int16_t nodeNumber; // written into new headers; one more than it goes into the lock's key
};

extern "C" SQLZ_KRCB* sqlz_krcbp;
