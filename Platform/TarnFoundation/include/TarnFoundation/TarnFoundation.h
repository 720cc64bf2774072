/// @file
/// The whole TarnFoundation API: Tarn::Exception and Tarn::TimeStamp.
#pragma once

#include <TarnFoundation/Exception.h>
#include <TarnFoundation/TimeStamp.h>
