#include <TarnMessaging/StationIDs.h>

namespace Tarn {

using kivcore::utility::ImmutableString;

// Defined in one translation unit, in this order, so that they are made in
// this order at load and destroyed in the reverse order at unload.
const ImmutableString kNoStation = ImmutableString::CreateStatic("");
const ImmutableString kStation_Idle = ImmutableString::CreateStatic("tarn.idle");
const ImmutableString kStation_Repeat = ImmutableString::CreateStatic("tarn.repeat");
const ImmutableString kStation_AppSuspend = ImmutableString::CreateStatic("tarn.app.suspend");
const ImmutableString kStation_AppResume = ImmutableString::CreateStatic("tarn.app.resume");
const ImmutableString kStation_AboutDialog = ImmutableString::CreateStatic("tarn.aboutdialog");
const ImmutableString kStation_DirectoryChange = ImmutableString::CreateStatic("tarn.directorychange");
const ImmutableString kStation_PanicSave = ImmutableString::CreateStatic("tarn.app.panic.save");
const ImmutableString kStation_StatusBar = ImmutableString::CreateStatic("tarn.app.status.bar");
const ImmutableString kStation_ColorPicker = ImmutableString::CreateStatic("tarn.app.color.picker");
const ImmutableString kStation_LocateClip = ImmutableString::CreateStatic("tarn.app.locate.clip");

}  // namespace Tarn
