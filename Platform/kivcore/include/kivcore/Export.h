// Export macro of the kivcore shared library: the library is built with
// hidden visibility, and only declarations carrying KIVCORE_API are public.
#pragma once

#define KIVCORE_API __attribute__((visibility("default")))
