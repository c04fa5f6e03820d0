#pragma once
// Checks of what arrives from ndi-testsrc: its colour bars and 1 kHz tone
// (pattern "bars"), its ramps (pattern "ramp") and its numbered bars
// (pattern "blocks"). Used by `pm-host demo`, the end-to-end tests (the
// vendor runtime's too) and the end-to-end benchmark.

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
// the first sample's s (modulo 1024). Empty when every sample is within
// `tolerance` of its value (0: exactly it).
std::string CheckRampSound(const AudioFrame& frame, std::int64_t* firstSample, float tolerance = 0);

// A "blocks" picture ('2vuy', 'NV12' or 'rgba'), at any size (the "lowest"
// proxy too): the average of the middle of each bar is within `tolerance` of
// the bar's colour in every channel, and the cells, each read from its
// middle, give a number whose check bits hold. Made for pictures that went
// through a lossy codec or a colour conversion. The default tolerance is 16
// for YUV pictures and 32 for RGB ones: the vendor runtime's YUV to RGB
// conversion puts the green of the cyan and green bars up to 24 above their
// BT.709 values.
struct BlocksReading {
  std::int64_t number = -1;  // the frame number's low 32 bits; -1 when unreadable
  std::string problem;       // empty when the bars and the number are right
};
BlocksReading ReadBlocks(const VideoFrame& frame, int tolerance = -1);

}  // namespace pmhost
