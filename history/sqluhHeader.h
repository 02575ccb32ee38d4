// What the header's source offers the reader of the committed history.
#pragma once

#include "history/sqluhist.h"

// sqluhReadHeader, with its results. operation: the name under which failures are logged; null:
// they are not, but for those of the entries that a header of an older version sends it to.
int sqluhTakeHeader(SQLO_FHANDLE fh, SQLUH_HEADER* header, const char* operation);
