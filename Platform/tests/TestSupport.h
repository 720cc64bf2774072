// Handshakes with bounded waits for the threaded tests: a test that would
// deadlock fails (or aborts with a message) instead of hanging.
#pragma once

#include "BoundedWait.h"

namespace platform_test = tarn_test;
