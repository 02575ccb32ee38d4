// The SQL communication area, which every layer carries: the outcome of a call, or of the operation
// that an entry records.
//
// The header is C11 as well as C++.
#pragma once

#include <assert.h>
#include <stddef.h>
#include <stdint.h>

typedef struct sqlca {
    char sqlcaid[8];    // identifier, no terminator
    int32_t sqlcabc;    // length of this record in bytes
    int32_t sqlcode;    // 0 success, negative failure, positive warning
    int16_t sqlerrml;   // length of the tokens in sqlerrmc
    char sqlerrmc[70];  // message tokens, no terminator
    char sqlerrp[8];    // product field, no terminator
    int32_t sqlerrd[6]; // diagnostic values
    char sqlwarn[11];   // warning letters
    char sqlstate[5];   // state, no terminator
} sqlca;
static_assert(sizeof(sqlca) == 136 && offsetof(sqlca, sqlcode) == 12, "layout");
