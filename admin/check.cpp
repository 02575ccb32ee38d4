#include "admin/zq3hist.h"
int checkMain(commandLine*)
{
    return 1;
}
