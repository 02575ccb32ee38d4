// zq3hist: looks after history directories.
#include "admin/zq3hist.h"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <unistd.h>

// A standard stream that the program was started without must not become a file that it opens:
// messages would go into that file. What takes its place refuses to be read or written.
static void fillStandardStreams(void)
{
    for (int stream = STDIN_FILENO; stream <= STDERR_FILENO; stream++)
        if (fcntl(stream, F_GETFD) == -1)
            open("/dev/null", stream == STDIN_FILENO ? O_WRONLY : O_RDONLY);
}

// Whoever reads only the beginning of a list does so on purpose.
static bool isReaderGone(void)
{
    pollfd out = {STDOUT_FILENO, POLLOUT, 0};
    return errno == EPIPE || (poll(&out, 1, 0) > 0 && (out.revents & POLLERR) != 0);
}

int main(int argc, char** argv)
{
    fillStandardStreams();
    // A reader that goes away is a failed write, never an end with the lock in hand.
    signal(SIGPIPE, SIG_IGN);
    int rc = runProgram(argc, argv);
    // A report that did not reach its reader must not end like one that did.
    bool written = ferror(stdout) == 0 && fflush(stdout) == 0;
    if (!written || (close(STDOUT_FILENO) != 0 && errno != EBADF)) {
        const char* what =
            hasChanged() ? "what was asked for is done, but cannot be told" : "cannot write";
        if (hasChanged() || !isReaderGone())
            fail("standard output", "%s: %s", what, strerror(errno));
        rc = rc != exitDone ? rc : exitFailed;
    }
    return rc;
}
