#include "admin/zq3hist.h"
int chartMain(commandLine*)
{
    return 1;
}
