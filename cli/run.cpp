#include "cli/run.h"

#include <cstdio>

int vsMain(int, char **) {
    std::fputs("not yet\n", stderr);
    return 1;
}
