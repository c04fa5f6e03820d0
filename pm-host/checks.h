#pragma once
// Checks of what arrives from ndi-testsrc: its colour bars and 1 kHz tone
// (pattern "bars"), and its ramps (pattern "ramp"). Used by `pm-host demo`
// and the end-to-end tests.

#include <cstdint>
#include <string>

#include "pm-host/queue_reader.h"

namespace pmhost {

// A '2vuy' picture of the bars: every row outside the moving marker's band
// equals the bars byte for byte; inside the band each pair of pixels is
// either the bars or the white marker. Empty when intact, else where not.
std::string CheckBars(const VideoFrame& frame);

// A snapshot (PNG) of the bars: every pixel is the bars' colour as the
// host's RGB conversion gives it, or the white marker inside its band. Empty
// when intact.
std::string CheckBarsPng(const std::string& path);

// Interleaved 'fl32' sound of the tone 0.25 x sin(2 pi 1000 t / rate) with t
// counting samples: each buffer continues some phase of it exactly. Empty
// when intact.
std::string CheckTone(const AudioFrame& frame);

// A ramp picture ('2vuy', 'NV12' or 'rgba') as the sender's FourCC laid it
// out; sets the frame number. Empty when intact.
std::string CheckRampPicture(const VideoFrame& frame, std::int64_t* frameNumber);

// Interleaved 'fl32' ramp sound: sample s of channel c is
// ((s + 7c) % 1024) / 1024 with s counting on from the sender's start; sets
// the first sample's s. Empty when intact.
std::string CheckRampSound(const AudioFrame& frame, std::int64_t* firstSample);

}  // namespace pmhost
