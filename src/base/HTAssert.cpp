#include "base/HTAssert.h"

#include <cstdio>
#include <cstdlib>

void htAssertFailed(const char* module, const char* condition, const char* file, int line)
{
    std::fprintf(stderr, "heft: %s: internal error: assertion failed: %s (%s:%d)\n", module, condition, file, line);
    std::fflush(stderr);
    std::abort();
}
