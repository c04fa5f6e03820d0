/* The NDI runtime's C interface: the structures, constants and functions this
 * project uses, laid out exactly as the runtime library expects them. The
 * loopback runtime (ndi-loopback) defines the functions; ndi-testsrc and the
 * benchmarks call them directly; the task module never links them but loads
 * each one by name into its NdiApi table (taskndisource/ndi_api.h), so that
 * the same task binary works with any runtime that exports these names; the
 * host reads the NDI constants. The structure layouts are pinned below for
 * 64-bit targets (they are the same on 64-bit Linux and Windows: int 4 bytes,
 * pointers 8, bool 1); taskndisource/ndi_abi_check.cc compares them with the
 * vendor's own headers where those are at hand.
 *
 * Conventions: handles are opaque pointers; bool is the one-byte C++ bool;
 * strings are NUL-terminated UTF-8; timestamps are in 100 ns units (0 = none);
 * captured frames belong to the runtime until freed with the matching call. */
#pragma once

#include <cstddef>
#include <cstdint>

extern "C" {

/* Frame types returned by the capture calls. */
enum : std::int32_t {
  kNdiFrameNone = 0,
  kNdiFrameVideo = 1,
  kNdiFrameAudio = 2,
  kNdiFrameMetadata = 3,
  kNdiFrameError = 4,
  kNdiFrameStatusChange = 100,
};

/* Receive bandwidth. */
enum : std::int32_t {
  kNdiBandwidthMetadataOnly = -10,
  kNdiBandwidthAudioOnly = 10,
  kNdiBandwidthLowest = 0,
  kNdiBandwidthHighest = 100,
};

/* Receive colour formats. */
enum : std::int32_t {
  kNdiColorBgrxBgra = 0,
  kNdiColorUyvyBgra = 1,
  kNdiColorRgbxRgba = 2,
  kNdiColorUyvyRgba = 3,
  kNdiColorFastest = 100,
};

/* Frame format types. */
enum : std::int32_t {
  kNdiFrameFormatInterleaved = 0,
  kNdiFrameFormatProgressive = 1,
  kNdiFrameFormatField0 = 2,
  kNdiFrameFormatField1 = 3,
};

/* Sender side: let the runtime make up the timecode. */
inline constexpr std::int64_t kNdiSendTimecodeSynthesize = INT64_MAX;

/* NDI FourCCs put the FIRST character in the LEAST significant byte. */
constexpr std::uint32_t NdiFourCC(char a, char b, char c, char d) {
  return static_cast<std::uint32_t>(static_cast<unsigned char>(a)) |
         static_cast<std::uint32_t>(static_cast<unsigned char>(b)) << 8 |
         static_cast<std::uint32_t>(static_cast<unsigned char>(c)) << 16 |
         static_cast<std::uint32_t>(static_cast<unsigned char>(d)) << 24;
}
inline constexpr std::uint32_t kNdiFourCCUYVY = NdiFourCC('U', 'Y', 'V', 'Y'); /* 0x59565955 */
inline constexpr std::uint32_t kNdiFourCCUYVA = NdiFourCC('U', 'Y', 'V', 'A');
inline constexpr std::uint32_t kNdiFourCCNV12 = NdiFourCC('N', 'V', '1', '2');
inline constexpr std::uint32_t kNdiFourCCI420 = NdiFourCC('I', '4', '2', '0');
inline constexpr std::uint32_t kNdiFourCCYV12 = NdiFourCC('Y', 'V', '1', '2');
inline constexpr std::uint32_t kNdiFourCCBGRA = NdiFourCC('B', 'G', 'R', 'A');
inline constexpr std::uint32_t kNdiFourCCBGRX = NdiFourCC('B', 'G', 'R', 'X');
inline constexpr std::uint32_t kNdiFourCCRGBA = NdiFourCC('R', 'G', 'B', 'A');
inline constexpr std::uint32_t kNdiFourCCRGBX = NdiFourCC('R', 'G', 'B', 'X');

struct ndi_source {
  const char* ndi_name;
  const char* url_address;
};

struct ndi_find_create {
  bool show_local_sources;
  const char* groups;
  const char* extra_ips;
};

struct ndi_recv_create {
  ndi_source source_to_connect_to;
  std::int32_t color_format;
  std::int32_t bandwidth;
  bool allow_video_fields;
};

struct ndi_video_frame_v2 {
  int xres;
  int yres;
  std::uint32_t FourCC;
  int frame_rate_N;
  int frame_rate_D;
  float picture_aspect_ratio;
  std::int32_t frame_format_type;
  std::int64_t timecode;
  std::uint8_t* data;
  int line_stride_in_bytes;
  const char* metadata;
  std::int64_t timestamp;
};

/* Planar float: channel c starts at (uint8*)data + c * channel_stride_in_bytes. */
struct ndi_audio_frame_v2 {
  int sample_rate;
  int no_channels;
  int no_samples;
  std::int64_t timecode;
  float* data;
  int channel_stride_in_bytes;
  const char* metadata;
  std::int64_t timestamp;
};

struct ndi_audio_frame_interleaved_32f {
  int sample_rate;
  int no_channels;
  int no_samples;
  std::int64_t timecode;
  float* data;
};

/* length counts the terminating zero. */
struct ndi_metadata_frame {
  int length;
  std::int64_t timecode;
  char* data;
};

struct ndi_tally {
  bool on_program;
  bool on_preview;
};

struct ndi_send_create {
  const char* ndi_name;
  const char* groups;
  bool clock_video;
  bool clock_audio;
};

/* The layouts, on every 64-bit target (LP64 and LLP64 alike). */
static_assert(sizeof(void*) == 8 && sizeof(int) == 4 && sizeof(bool) == 1 && sizeof(float) == 4,
              "the NDI structures are laid out for 64-bit targets");

static_assert(sizeof(ndi_source) == 16 && alignof(ndi_source) == 8);
static_assert(offsetof(ndi_source, ndi_name) == 0 && offsetof(ndi_source, url_address) == 8);

static_assert(sizeof(ndi_find_create) == 24);
static_assert(offsetof(ndi_find_create, show_local_sources) == 0 && offsetof(ndi_find_create, groups) == 8 &&
              offsetof(ndi_find_create, extra_ips) == 16);

static_assert(sizeof(ndi_recv_create) == 32);
static_assert(offsetof(ndi_recv_create, source_to_connect_to) == 0 && offsetof(ndi_recv_create, color_format) == 16 &&
              offsetof(ndi_recv_create, bandwidth) == 20 && offsetof(ndi_recv_create, allow_video_fields) == 24);

static_assert(sizeof(ndi_video_frame_v2) == 72);
static_assert(offsetof(ndi_video_frame_v2, xres) == 0 && offsetof(ndi_video_frame_v2, yres) == 4 &&
              offsetof(ndi_video_frame_v2, FourCC) == 8 && offsetof(ndi_video_frame_v2, frame_rate_N) == 12 &&
              offsetof(ndi_video_frame_v2, frame_rate_D) == 16 &&
              offsetof(ndi_video_frame_v2, picture_aspect_ratio) == 20 &&
              offsetof(ndi_video_frame_v2, frame_format_type) == 24 && offsetof(ndi_video_frame_v2, timecode) == 32 &&
              offsetof(ndi_video_frame_v2, data) == 40 && offsetof(ndi_video_frame_v2, line_stride_in_bytes) == 48 &&
              offsetof(ndi_video_frame_v2, metadata) == 56 && offsetof(ndi_video_frame_v2, timestamp) == 64);

static_assert(sizeof(ndi_audio_frame_v2) == 56);
static_assert(offsetof(ndi_audio_frame_v2, sample_rate) == 0 && offsetof(ndi_audio_frame_v2, no_channels) == 4 &&
              offsetof(ndi_audio_frame_v2, no_samples) == 8 && offsetof(ndi_audio_frame_v2, timecode) == 16 &&
              offsetof(ndi_audio_frame_v2, data) == 24 && offsetof(ndi_audio_frame_v2, channel_stride_in_bytes) == 32 &&
              offsetof(ndi_audio_frame_v2, metadata) == 40 && offsetof(ndi_audio_frame_v2, timestamp) == 48);

static_assert(sizeof(ndi_audio_frame_interleaved_32f) == 32);
static_assert(offsetof(ndi_audio_frame_interleaved_32f, sample_rate) == 0 &&
              offsetof(ndi_audio_frame_interleaved_32f, no_channels) == 4 &&
              offsetof(ndi_audio_frame_interleaved_32f, no_samples) == 8 &&
              offsetof(ndi_audio_frame_interleaved_32f, timecode) == 16 &&
              offsetof(ndi_audio_frame_interleaved_32f, data) == 24);

static_assert(sizeof(ndi_metadata_frame) == 24);
static_assert(offsetof(ndi_metadata_frame, length) == 0 && offsetof(ndi_metadata_frame, timecode) == 8 &&
              offsetof(ndi_metadata_frame, data) == 16);

static_assert(sizeof(ndi_tally) == 2);
static_assert(offsetof(ndi_tally, on_program) == 0 && offsetof(ndi_tally, on_preview) == 1);

static_assert(sizeof(ndi_send_create) == 24);
static_assert(offsetof(ndi_send_create, ndi_name) == 0 && offsetof(ndi_send_create, groups) == 8 &&
              offsetof(ndi_send_create, clock_video) == 16 && offsetof(ndi_send_create, clock_audio) == 17);

/* Library. */
bool NDIlib_initialize(void);
void NDIlib_destroy(void);
const char* NDIlib_version(void);
bool NDIlib_is_supported_CPU(void);

/* Finder. */
void* NDIlib_find_create_v2(const ndi_find_create* settings);
void NDIlib_find_destroy(void* finder);
const ndi_source* NDIlib_find_get_current_sources(void* finder, std::uint32_t* count);
bool NDIlib_find_wait_for_sources(void* finder, std::uint32_t timeout_ms);

/* Receiver. */
void* NDIlib_recv_create_v2(const ndi_recv_create* settings);
void NDIlib_recv_destroy(void* receiver);
int NDIlib_recv_get_no_connections(void* receiver);
std::int32_t NDIlib_recv_capture_v2(void* receiver, ndi_video_frame_v2* video, ndi_audio_frame_v2* audio,
                                    ndi_metadata_frame* metadata, std::uint32_t timeout_ms);
void NDIlib_recv_free_video_v2(void* receiver, const ndi_video_frame_v2* video);
void NDIlib_recv_free_audio_v2(void* receiver, const ndi_audio_frame_v2* audio);
void NDIlib_recv_free_metadata(void* receiver, const ndi_metadata_frame* metadata);
bool NDIlib_recv_set_tally(void* receiver, const ndi_tally* tally);
bool NDIlib_recv_send_metadata(void* receiver, const ndi_metadata_frame* metadata);

/* PTZ. */
bool NDIlib_recv_ptz_is_supported(void* receiver);
bool NDIlib_recv_ptz_recall_preset(void* receiver, int preset, float speed);
bool NDIlib_recv_ptz_store_preset(void* receiver, int preset);
bool NDIlib_recv_ptz_pan_tilt(void* receiver, float pan, float tilt);
bool NDIlib_recv_ptz_pan_tilt_speed(void* receiver, float pan_speed, float tilt_speed);
bool NDIlib_recv_ptz_zoom(void* receiver, float zoom);
bool NDIlib_recv_ptz_focus(void* receiver, float focus);
bool NDIlib_recv_ptz_focus_speed(void* receiver, float focus_speed);
bool NDIlib_recv_ptz_auto_focus(void* receiver);
bool NDIlib_recv_ptz_exposure_auto(void* receiver);
bool NDIlib_recv_ptz_exposure_manual(void* receiver, float level);
bool NDIlib_recv_ptz_white_balance_auto(void* receiver);
bool NDIlib_recv_ptz_white_balance_indoor(void* receiver);
bool NDIlib_recv_ptz_white_balance_outdoor(void* receiver);
bool NDIlib_recv_ptz_white_balance_oneshot(void* receiver);
bool NDIlib_recv_ptz_white_balance_manual(void* receiver, float red, float blue);

/* Utility: writes no_samples x no_channels floats, sample-major, to dst->data. */
void NDIlib_util_audio_to_interleaved_32f_v2(const ndi_audio_frame_v2* src, ndi_audio_frame_interleaved_32f* dst);

/* Sender (ndi-testsrc and the tests; never the task). */
void* NDIlib_send_create(const ndi_send_create* settings);
void NDIlib_send_destroy(void* sender);
void NDIlib_send_send_video_v2(void* sender, const ndi_video_frame_v2* video);
void NDIlib_send_send_audio_v2(void* sender, const ndi_audio_frame_v2* audio);
void NDIlib_send_send_metadata(void* sender, const ndi_metadata_frame* metadata);
std::int32_t NDIlib_send_capture(void* sender, ndi_metadata_frame* metadata, std::uint32_t timeout_ms);
void NDIlib_send_free_metadata(void* sender, const ndi_metadata_frame* metadata);
bool NDIlib_send_get_tally(void* sender, ndi_tally* tally, std::uint32_t timeout_ms);
int NDIlib_send_get_no_connections(void* sender, std::uint32_t timeout_ms);
void NDIlib_send_add_connection_metadata(void* sender, const ndi_metadata_frame* metadata);
void NDIlib_send_clear_connection_metadata(void* sender);

}  /* extern "C" */
