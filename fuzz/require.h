// A condition that must hold in a fuzzer: otherwise the run ends, with the input as a finding.
#pragma once

#include <cstdio>
#include <cstdlib>

inline void require_true(bool condition, const char *what) {
    if (condition)
        return;
    fprintf(stderr, "not true: %s\n", what);
    abort();
}
#define REQUIRE(condition) require_true((condition), #condition)
