/// @file
/// The well-known station IDs on which independent parts of a host meet.
/// Library initialization registers the ten kStation_ IDs (plain stations,
/// made on first use); kNoStation is the empty ID and names no station.
///
/// Threading: constants made at load; read them from any thread.
#pragma once

#include <TarnMessaging/Export.h>

#include <kivcore/ImmutableString.h>

namespace Tarn {

/// The empty station ID, kNoStation, which names no station, and the ten
/// well-known station IDs that Tarn::Messaging::Initialize registers; the
/// comment on each gives its text.
/// @{
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kNoStation;                // ""
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_Idle;             // "tarn.idle"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_Repeat;           // "tarn.repeat"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_AppSuspend;       // "tarn.app.suspend"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_AppResume;        // "tarn.app.resume"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_AboutDialog;      // "tarn.aboutdialog"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_DirectoryChange;  // "tarn.directorychange"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_PanicSave;        // "tarn.app.panic.save"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_StatusBar;        // "tarn.app.status.bar"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_ColorPicker;      // "tarn.app.color.picker"
TARN_MESSAGING_API extern const kivcore::utility::ImmutableString kStation_LocateClip;       // "tarn.app.locate.clip"
/// @}

}  // namespace Tarn
