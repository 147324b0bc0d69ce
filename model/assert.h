#pragma once

// Invariant checks that stay on in every build type. A failed check prints
// the condition's text with its location and aborts: these guard programming
// errors only, never bad input.

#include <cstdio>
#include <cstdlib>

namespace vs {

[[noreturn]] inline void assertionFailed(const char *text, const char *file, int line,
                                         const char *function) {
    std::fprintf(stderr, "Assertion failed: (%s), function %s, file %s, line %d.\n", text,
                 function, file, line);
    std::fflush(stderr);
    std::abort();
}

} // namespace vs

// VS_ASSERT(cond) reports the condition as written.
#define VS_ASSERT(cond) \
    ((cond) ? static_cast<void>(0) : ::vs::assertionFailed(#cond, __FILE__, __LINE__, __func__))

// VS_ASSERT_MSG(cond, text) reports `text` instead, for conditions whose
// C++ spelling differs from the way the model states the invariant.
#define VS_ASSERT_MSG(cond, text) \
    ((cond) ? static_cast<void>(0) : ::vs::assertionFailed((text), __FILE__, __LINE__, __func__))
