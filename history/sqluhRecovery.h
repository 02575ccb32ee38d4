// What recovery offers open, close and the utilities, beside what sqluhist.h declares: what has to
// be done around the replacement of a whole history file, so that a stop at any moment leaves the
// old or the new history.
#pragma once

#include "history/sqluhist.h"

// Before the history file is replaced: the shadow, if there is anything to keep, holds what is
// committed, and durably says 'P'. An open then takes the shadow while the history file cannot be
// used, and the history file as soon as it can. No file is open through the handle. Returns 0; what
// kept a file from being looked at; the copy's code; a code of sqluhUpdateHeaderStatus; a sync's.
int sqluhKeepCommitted(SQLUH_HANDLE* handle);

// Puts the image in force that was written over the marked history file, which is still open: from
// now on an open takes it. Returns 0, also for a handle that no image was written through; or, with
// the old history in force, the code of the piece that failed, sqloNLCKLost, the code of the call
// that looked for room or took off the mark, or a code of sqluhKeepCommitted.
int sqluhCommitRestore(SQLUH_HANDLE* handle);
