// The platform and host tests' helpers, now all in support/test_util.h.
#ifndef S2S_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H
#define S2S_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H

#include "s2s_logger.h"
#include "s2s_platform.h"
#include "support/test_util.h"

#endif  // S2S_TESTS_PLATFORM_PLATFORM_TEST_UTIL_H
