// Export macro of the TarnMessaging shared library: it is built with hidden
// visibility, and only declarations carrying TARN_MESSAGING_API are public.
#pragma once

#define TARN_MESSAGING_API __attribute__((visibility("default")))

/// Keeps a member of an exported class inside the library: for private
/// helpers that only the library's own code calls.
#define TARN_MESSAGING_LOCAL __attribute__((visibility("hidden")))
