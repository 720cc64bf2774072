// A separate shared library for the interning test: it makes strings with its
// own copy of every inline function of ImmutableString.h, so that the test can
// check that identities are the process's, not each module's.
#include <kivcore/ImmutableString.h>

extern "C" __attribute__((visibility("default"))) void InternModuleMakeStatic(
    const char* inText, kivcore::utility::ImmutableString* outString) {
  *outString = kivcore::utility::ImmutableString::CreateStatic(inText);
}

extern "C" __attribute__((visibility("default"))) void InternModuleMakeDynamic(
    const char* inText, kivcore::utility::ImmutableString* outString) {
  *outString = kivcore::utility::ImmutableString::CreateDynamic(inText);
}
