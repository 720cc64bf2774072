// Export macro of the TarnRemote shared library: it is built with hidden
// visibility, and only declarations carrying TARN_REMOTE_API are public.
#pragma once

#define TARN_REMOTE_API __attribute__((visibility("default")))
