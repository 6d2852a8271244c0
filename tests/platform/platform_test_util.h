// Left for the section-file tests that still include it: the helpers live in support/test_util.h.
#pragma once
#include "support/test_util.h"
