// Compile-time proof that our NDI declarations (ndi/ndi_abi.h and
// the NdiApi table) match the vendor runtime's C headers: the size, alignment
// and every field offset and type of each structure we use, the value of each
// constant, and the type of each function we call or load. Built only when
// the vendor headers are at hand (-DPM_NDI_VENDOR_DIR, scripts/test's vendor
// leg); this is the one file that includes them. A mismatch is a compile
// error naming the item.
//
// The vendor's functions carry the same exported names as ours, with their
// own structure types, so its header is read with each of those names
// renamed (vendor_NDIlib_...): both sets of declarations then live side by
// side, and each pair is compared parameter by parameter, a vendor structure
// standing for ours when the two are listed as a pair below.
#include <cstddef>
#include <cstdint>
#include <type_traits>

#define PM_NDI_FUNCTIONS(X)                                                                                        \
  X(initialize) X(destroy) X(version) X(is_supported_CPU) X(find_create_v2) X(find_destroy)                        \
  X(find_get_current_sources) X(find_wait_for_sources) X(recv_create_v2) X(recv_destroy) X(recv_get_no_connections) \
  X(recv_capture_v2) X(recv_free_video_v2) X(recv_free_audio_v2) X(recv_free_metadata) X(recv_set_tally)            \
  X(recv_send_metadata) X(recv_ptz_is_supported) X(recv_ptz_recall_preset) X(recv_ptz_store_preset)                \
  X(recv_ptz_pan_tilt) X(recv_ptz_pan_tilt_speed) X(recv_ptz_zoom) X(recv_ptz_focus) X(recv_ptz_focus_speed)       \
  X(recv_ptz_auto_focus) X(recv_ptz_exposure_auto) X(recv_ptz_exposure_manual) X(recv_ptz_white_balance_auto)      \
  X(recv_ptz_white_balance_indoor) X(recv_ptz_white_balance_outdoor) X(recv_ptz_white_balance_oneshot)             \
  X(recv_ptz_white_balance_manual) X(util_audio_to_interleaved_32f_v2) X(send_create) X(send_destroy)              \
  X(send_send_video_v2) X(send_send_audio_v2) X(send_send_metadata) X(send_capture) X(send_free_metadata)          \
  X(send_get_tally) X(send_get_no_connections) X(send_add_connection_metadata) X(send_clear_connection_metadata)

// The vendor's declarations, under other names.
#define NDIlib_initialize vendor_NDIlib_initialize
#define NDIlib_destroy vendor_NDIlib_destroy
#define NDIlib_version vendor_NDIlib_version
#define NDIlib_is_supported_CPU vendor_NDIlib_is_supported_CPU
#define NDIlib_find_create_v2 vendor_NDIlib_find_create_v2
#define NDIlib_find_destroy vendor_NDIlib_find_destroy
#define NDIlib_find_get_current_sources vendor_NDIlib_find_get_current_sources
#define NDIlib_find_wait_for_sources vendor_NDIlib_find_wait_for_sources
#define NDIlib_recv_create_v2 vendor_NDIlib_recv_create_v2
#define NDIlib_recv_destroy vendor_NDIlib_recv_destroy
#define NDIlib_recv_get_no_connections vendor_NDIlib_recv_get_no_connections
#define NDIlib_recv_capture_v2 vendor_NDIlib_recv_capture_v2
#define NDIlib_recv_free_video_v2 vendor_NDIlib_recv_free_video_v2
#define NDIlib_recv_free_audio_v2 vendor_NDIlib_recv_free_audio_v2
#define NDIlib_recv_free_metadata vendor_NDIlib_recv_free_metadata
#define NDIlib_recv_set_tally vendor_NDIlib_recv_set_tally
#define NDIlib_recv_send_metadata vendor_NDIlib_recv_send_metadata
#define NDIlib_recv_ptz_is_supported vendor_NDIlib_recv_ptz_is_supported
#define NDIlib_recv_ptz_recall_preset vendor_NDIlib_recv_ptz_recall_preset
#define NDIlib_recv_ptz_store_preset vendor_NDIlib_recv_ptz_store_preset
#define NDIlib_recv_ptz_pan_tilt vendor_NDIlib_recv_ptz_pan_tilt
#define NDIlib_recv_ptz_pan_tilt_speed vendor_NDIlib_recv_ptz_pan_tilt_speed
#define NDIlib_recv_ptz_zoom vendor_NDIlib_recv_ptz_zoom
#define NDIlib_recv_ptz_focus vendor_NDIlib_recv_ptz_focus
#define NDIlib_recv_ptz_focus_speed vendor_NDIlib_recv_ptz_focus_speed
#define NDIlib_recv_ptz_auto_focus vendor_NDIlib_recv_ptz_auto_focus
#define NDIlib_recv_ptz_exposure_auto vendor_NDIlib_recv_ptz_exposure_auto
#define NDIlib_recv_ptz_exposure_manual vendor_NDIlib_recv_ptz_exposure_manual
#define NDIlib_recv_ptz_white_balance_auto vendor_NDIlib_recv_ptz_white_balance_auto
#define NDIlib_recv_ptz_white_balance_indoor vendor_NDIlib_recv_ptz_white_balance_indoor
#define NDIlib_recv_ptz_white_balance_outdoor vendor_NDIlib_recv_ptz_white_balance_outdoor
#define NDIlib_recv_ptz_white_balance_oneshot vendor_NDIlib_recv_ptz_white_balance_oneshot
#define NDIlib_recv_ptz_white_balance_manual vendor_NDIlib_recv_ptz_white_balance_manual
#define NDIlib_util_audio_to_interleaved_32f_v2 vendor_NDIlib_util_audio_to_interleaved_32f_v2
#define NDIlib_send_create vendor_NDIlib_send_create
#define NDIlib_send_destroy vendor_NDIlib_send_destroy
#define NDIlib_send_send_video_v2 vendor_NDIlib_send_send_video_v2
#define NDIlib_send_send_audio_v2 vendor_NDIlib_send_send_audio_v2
#define NDIlib_send_send_metadata vendor_NDIlib_send_send_metadata
#define NDIlib_send_capture vendor_NDIlib_send_capture
#define NDIlib_send_free_metadata vendor_NDIlib_send_free_metadata
#define NDIlib_send_get_tally vendor_NDIlib_send_get_tally
#define NDIlib_send_get_no_connections vendor_NDIlib_send_get_no_connections
#define NDIlib_send_add_connection_metadata vendor_NDIlib_send_add_connection_metadata
#define NDIlib_send_clear_connection_metadata vendor_NDIlib_send_clear_connection_metadata
#include <Processing.NDI.Lib.h>
#undef NDIlib_initialize
#undef NDIlib_destroy
#undef NDIlib_version
#undef NDIlib_is_supported_CPU
#undef NDIlib_find_create_v2
#undef NDIlib_find_destroy
#undef NDIlib_find_get_current_sources
#undef NDIlib_find_wait_for_sources
#undef NDIlib_recv_create_v2
#undef NDIlib_recv_destroy
#undef NDIlib_recv_get_no_connections
#undef NDIlib_recv_capture_v2
#undef NDIlib_recv_free_video_v2
#undef NDIlib_recv_free_audio_v2
#undef NDIlib_recv_free_metadata
#undef NDIlib_recv_set_tally
#undef NDIlib_recv_send_metadata
#undef NDIlib_recv_ptz_is_supported
#undef NDIlib_recv_ptz_recall_preset
#undef NDIlib_recv_ptz_store_preset
#undef NDIlib_recv_ptz_pan_tilt
#undef NDIlib_recv_ptz_pan_tilt_speed
#undef NDIlib_recv_ptz_zoom
#undef NDIlib_recv_ptz_focus
#undef NDIlib_recv_ptz_focus_speed
#undef NDIlib_recv_ptz_auto_focus
#undef NDIlib_recv_ptz_exposure_auto
#undef NDIlib_recv_ptz_exposure_manual
#undef NDIlib_recv_ptz_white_balance_auto
#undef NDIlib_recv_ptz_white_balance_indoor
#undef NDIlib_recv_ptz_white_balance_outdoor
#undef NDIlib_recv_ptz_white_balance_oneshot
#undef NDIlib_recv_ptz_white_balance_manual
#undef NDIlib_util_audio_to_interleaved_32f_v2
#undef NDIlib_send_create
#undef NDIlib_send_destroy
#undef NDIlib_send_send_video_v2
#undef NDIlib_send_send_audio_v2
#undef NDIlib_send_send_metadata
#undef NDIlib_send_capture
#undef NDIlib_send_free_metadata
#undef NDIlib_send_get_tally
#undef NDIlib_send_get_no_connections
#undef NDIlib_send_add_connection_metadata
#undef NDIlib_send_clear_connection_metadata

#include "ndi/ndi_abi.h"
#include "taskndisource/ndi_api.h"

namespace {

// Which vendor structure stands for which of ours.
template <class Ours>
struct VendorOf {
  using type = void;
};
#define PM_NDI_PAIR(ours, theirs) \
  template <>                     \
  struct VendorOf<ours> {         \
    using type = theirs;          \
  };
PM_NDI_PAIR(ndi_source, NDIlib_source_t)
PM_NDI_PAIR(ndi_find_create, NDIlib_find_create_t)
PM_NDI_PAIR(ndi_recv_create, NDIlib_recv_create_t)
PM_NDI_PAIR(ndi_video_frame_v2, NDIlib_video_frame_v2_t)
PM_NDI_PAIR(ndi_audio_frame_v2, NDIlib_audio_frame_v2_t)
PM_NDI_PAIR(ndi_audio_frame_interleaved_32f, NDIlib_audio_frame_interleaved_32f_t)
PM_NDI_PAIR(ndi_metadata_frame, NDIlib_metadata_frame_t)
PM_NDI_PAIR(ndi_tally, NDIlib_tally_t)
PM_NDI_PAIR(ndi_send_create, NDIlib_send_create_t)
#undef PM_NDI_PAIR

// Ours and theirs are the same to the machine: the same type; a listed
// structure pair; our int32 for one of their 32-bit enums; our void* for
// their opaque handle; and pointers, qualifiers and function types made of
// such parts, parameter for parameter.
template <class Ours, class Theirs>
struct Corresponds : std::false_type {};
template <class T>
struct Corresponds<T, T> : std::true_type {};
template <class Ours, class Theirs>
  requires(!std::is_same_v<Ours, Theirs> && std::is_same_v<typename VendorOf<Ours>::type, Theirs>)
struct Corresponds<Ours, Theirs> : std::true_type {};
template <class Ours, class Theirs>
  requires(!std::is_same_v<Ours, Theirs> && (std::is_same_v<Ours, std::int32_t> || std::is_same_v<Ours, std::uint32_t>) &&
           std::is_enum_v<Theirs> && sizeof(Theirs) == sizeof(Ours))
struct Corresponds<Ours, Theirs> : std::true_type {};
template <class Theirs>
  requires(std::is_class_v<Theirs>)
struct Corresponds<void*, Theirs*> : std::true_type {};
template <class Ours, class Theirs>
  requires(!std::is_same_v<Ours, Theirs> && !(std::is_void_v<Ours> && std::is_class_v<Theirs>))
struct Corresponds<Ours*, Theirs*> : Corresponds<Ours, Theirs> {};
template <class Ours, class Theirs>
  requires(!std::is_same_v<Ours, Theirs>)
struct Corresponds<const Ours, const Theirs> : Corresponds<Ours, Theirs> {};
template <class... T>
struct List {};
template <class Ours, class Theirs>
struct EachCorresponds : std::false_type {};
template <class... A1, class... A2>
  requires(sizeof...(A1) == sizeof...(A2))
struct EachCorresponds<List<A1...>, List<A2...>> : std::bool_constant<(Corresponds<A1, A2>::value && ...)> {};
template <class R1, class... A1, class R2, class... A2>
  requires(!std::is_same_v<R1(A1...), R2(A2...)>)
struct Corresponds<R1(A1...), R2(A2...)>
    : std::bool_constant<Corresponds<R1, R2>::value && EachCorresponds<List<A1...>, List<A2...>>::value> {};

// Structures: size, alignment, and each field's offset and type.
template <class Ours, class Theirs>
constexpr bool kSameShape = sizeof(Ours) == sizeof(Theirs) && alignof(Ours) == alignof(Theirs);
#define PM_NDI_STRUCT(ours, theirs) static_assert(kSameShape<ours, theirs>, #ours " differs in size or alignment");
#define PM_NDI_FIELD(ours, field, theirs, their_field)                                                  \
  static_assert(offsetof(ours, field) == offsetof(theirs, their_field), #ours "." #field " moved");       \
  static_assert(Corresponds<decltype(ours::field), decltype(theirs::their_field)>::value,                \
                #ours "." #field " has another type");

PM_NDI_STRUCT(ndi_source, NDIlib_source_t)
PM_NDI_FIELD(ndi_source, ndi_name, NDIlib_source_t, p_ndi_name)
PM_NDI_FIELD(ndi_source, url_address, NDIlib_source_t, p_url_address)

PM_NDI_STRUCT(ndi_find_create, NDIlib_find_create_t)
PM_NDI_FIELD(ndi_find_create, show_local_sources, NDIlib_find_create_t, show_local_sources)
PM_NDI_FIELD(ndi_find_create, groups, NDIlib_find_create_t, p_groups)
PM_NDI_FIELD(ndi_find_create, extra_ips, NDIlib_find_create_t, p_extra_ips)

PM_NDI_STRUCT(ndi_recv_create, NDIlib_recv_create_t)
PM_NDI_FIELD(ndi_recv_create, source_to_connect_to, NDIlib_recv_create_t, source_to_connect_to)
PM_NDI_FIELD(ndi_recv_create, color_format, NDIlib_recv_create_t, color_format)
PM_NDI_FIELD(ndi_recv_create, bandwidth, NDIlib_recv_create_t, bandwidth)
PM_NDI_FIELD(ndi_recv_create, allow_video_fields, NDIlib_recv_create_t, allow_video_fields)

PM_NDI_STRUCT(ndi_video_frame_v2, NDIlib_video_frame_v2_t)
PM_NDI_FIELD(ndi_video_frame_v2, xres, NDIlib_video_frame_v2_t, xres)
PM_NDI_FIELD(ndi_video_frame_v2, yres, NDIlib_video_frame_v2_t, yres)
PM_NDI_FIELD(ndi_video_frame_v2, FourCC, NDIlib_video_frame_v2_t, FourCC)
PM_NDI_FIELD(ndi_video_frame_v2, frame_rate_N, NDIlib_video_frame_v2_t, frame_rate_N)
PM_NDI_FIELD(ndi_video_frame_v2, frame_rate_D, NDIlib_video_frame_v2_t, frame_rate_D)
PM_NDI_FIELD(ndi_video_frame_v2, picture_aspect_ratio, NDIlib_video_frame_v2_t, picture_aspect_ratio)
PM_NDI_FIELD(ndi_video_frame_v2, frame_format_type, NDIlib_video_frame_v2_t, frame_format_type)
PM_NDI_FIELD(ndi_video_frame_v2, timecode, NDIlib_video_frame_v2_t, timecode)
PM_NDI_FIELD(ndi_video_frame_v2, data, NDIlib_video_frame_v2_t, p_data)
PM_NDI_FIELD(ndi_video_frame_v2, line_stride_in_bytes, NDIlib_video_frame_v2_t, line_stride_in_bytes)
PM_NDI_FIELD(ndi_video_frame_v2, metadata, NDIlib_video_frame_v2_t, p_metadata)
PM_NDI_FIELD(ndi_video_frame_v2, timestamp, NDIlib_video_frame_v2_t, timestamp)

PM_NDI_STRUCT(ndi_audio_frame_v2, NDIlib_audio_frame_v2_t)
PM_NDI_FIELD(ndi_audio_frame_v2, sample_rate, NDIlib_audio_frame_v2_t, sample_rate)
PM_NDI_FIELD(ndi_audio_frame_v2, no_channels, NDIlib_audio_frame_v2_t, no_channels)
PM_NDI_FIELD(ndi_audio_frame_v2, no_samples, NDIlib_audio_frame_v2_t, no_samples)
PM_NDI_FIELD(ndi_audio_frame_v2, timecode, NDIlib_audio_frame_v2_t, timecode)
PM_NDI_FIELD(ndi_audio_frame_v2, data, NDIlib_audio_frame_v2_t, p_data)
PM_NDI_FIELD(ndi_audio_frame_v2, channel_stride_in_bytes, NDIlib_audio_frame_v2_t, channel_stride_in_bytes)
PM_NDI_FIELD(ndi_audio_frame_v2, metadata, NDIlib_audio_frame_v2_t, p_metadata)
PM_NDI_FIELD(ndi_audio_frame_v2, timestamp, NDIlib_audio_frame_v2_t, timestamp)

PM_NDI_STRUCT(ndi_audio_frame_interleaved_32f, NDIlib_audio_frame_interleaved_32f_t)
PM_NDI_FIELD(ndi_audio_frame_interleaved_32f, sample_rate, NDIlib_audio_frame_interleaved_32f_t, sample_rate)
PM_NDI_FIELD(ndi_audio_frame_interleaved_32f, no_channels, NDIlib_audio_frame_interleaved_32f_t, no_channels)
PM_NDI_FIELD(ndi_audio_frame_interleaved_32f, no_samples, NDIlib_audio_frame_interleaved_32f_t, no_samples)
PM_NDI_FIELD(ndi_audio_frame_interleaved_32f, timecode, NDIlib_audio_frame_interleaved_32f_t, timecode)
PM_NDI_FIELD(ndi_audio_frame_interleaved_32f, data, NDIlib_audio_frame_interleaved_32f_t, p_data)

PM_NDI_STRUCT(ndi_metadata_frame, NDIlib_metadata_frame_t)
PM_NDI_FIELD(ndi_metadata_frame, length, NDIlib_metadata_frame_t, length)
PM_NDI_FIELD(ndi_metadata_frame, timecode, NDIlib_metadata_frame_t, timecode)
PM_NDI_FIELD(ndi_metadata_frame, data, NDIlib_metadata_frame_t, p_data)

PM_NDI_STRUCT(ndi_tally, NDIlib_tally_t)
PM_NDI_FIELD(ndi_tally, on_program, NDIlib_tally_t, on_program)
PM_NDI_FIELD(ndi_tally, on_preview, NDIlib_tally_t, on_preview)

PM_NDI_STRUCT(ndi_send_create, NDIlib_send_create_t)
PM_NDI_FIELD(ndi_send_create, ndi_name, NDIlib_send_create_t, p_ndi_name)
PM_NDI_FIELD(ndi_send_create, groups, NDIlib_send_create_t, p_groups)
PM_NDI_FIELD(ndi_send_create, clock_video, NDIlib_send_create_t, clock_video)
PM_NDI_FIELD(ndi_send_create, clock_audio, NDIlib_send_create_t, clock_audio)
#undef PM_NDI_STRUCT
#undef PM_NDI_FIELD

// Constants.
#define PM_NDI_VALUE(ours, theirs) \
  static_assert(static_cast<std::int64_t>(ours) == static_cast<std::int64_t>(theirs), #ours " is not " #theirs);
PM_NDI_VALUE(kNdiFrameNone, NDIlib_frame_type_none)
PM_NDI_VALUE(kNdiFrameVideo, NDIlib_frame_type_video)
PM_NDI_VALUE(kNdiFrameAudio, NDIlib_frame_type_audio)
PM_NDI_VALUE(kNdiFrameMetadata, NDIlib_frame_type_metadata)
PM_NDI_VALUE(kNdiFrameError, NDIlib_frame_type_error)
PM_NDI_VALUE(kNdiFrameStatusChange, NDIlib_frame_type_status_change)
PM_NDI_VALUE(kNdiBandwidthMetadataOnly, NDIlib_recv_bandwidth_metadata_only)
PM_NDI_VALUE(kNdiBandwidthAudioOnly, NDIlib_recv_bandwidth_audio_only)
PM_NDI_VALUE(kNdiBandwidthLowest, NDIlib_recv_bandwidth_lowest)
PM_NDI_VALUE(kNdiBandwidthHighest, NDIlib_recv_bandwidth_highest)
PM_NDI_VALUE(kNdiColorBgrxBgra, NDIlib_recv_color_format_BGRX_BGRA)
PM_NDI_VALUE(kNdiColorUyvyBgra, NDIlib_recv_color_format_UYVY_BGRA)
PM_NDI_VALUE(kNdiColorRgbxRgba, NDIlib_recv_color_format_RGBX_RGBA)
PM_NDI_VALUE(kNdiColorUyvyRgba, NDIlib_recv_color_format_UYVY_RGBA)
PM_NDI_VALUE(kNdiColorFastest, NDIlib_recv_color_format_fastest)
PM_NDI_VALUE(kNdiFrameFormatInterleaved, NDIlib_frame_format_type_interleaved)
PM_NDI_VALUE(kNdiFrameFormatProgressive, NDIlib_frame_format_type_progressive)
PM_NDI_VALUE(kNdiFrameFormatField0, NDIlib_frame_format_type_field_0)
PM_NDI_VALUE(kNdiFrameFormatField1, NDIlib_frame_format_type_field_1)
PM_NDI_VALUE(kNdiSendTimecodeSynthesize, NDIlib_send_timecode_synthesize)
PM_NDI_VALUE(kNdiFourCCUYVY, NDIlib_FourCC_video_type_UYVY)
PM_NDI_VALUE(kNdiFourCCUYVA, NDIlib_FourCC_video_type_UYVA)
PM_NDI_VALUE(kNdiFourCCNV12, NDIlib_FourCC_video_type_NV12)
PM_NDI_VALUE(kNdiFourCCI420, NDIlib_FourCC_video_type_I420)
PM_NDI_VALUE(kNdiFourCCYV12, NDIlib_FourCC_video_type_YV12)
PM_NDI_VALUE(kNdiFourCCBGRA, NDIlib_FourCC_video_type_BGRA)
PM_NDI_VALUE(kNdiFourCCBGRX, NDIlib_FourCC_video_type_BGRX)
PM_NDI_VALUE(kNdiFourCCRGBA, NDIlib_FourCC_video_type_RGBA)
PM_NDI_VALUE(kNdiFourCCRGBX, NDIlib_FourCC_video_type_RGBX)
#undef PM_NDI_VALUE

// Functions: each one declared in ndi_abi.h, and each entry of the task's
// NdiApi table, against the vendor's declaration of the same name.
#define PM_NDI_FUNCTION(name)                                                                   \
  static_assert(Corresponds<decltype(&::NDIlib_##name), decltype(&::vendor_NDIlib_##name)>::value, \
                "NDIlib_" #name " has another type than the runtime's");
PM_NDI_FUNCTIONS(PM_NDI_FUNCTION)
#undef PM_NDI_FUNCTION

// Every NdiApi entry is one of the functions above, and of the same type.
#define PM_NDI_TABLE(name)                                                                             \
  static_assert(Corresponds<decltype(TaskNDISource::NdiApi::name), decltype(&::vendor_NDIlib_##name)>::value, \
                "NdiApi::" #name " has another type than the runtime's");
PM_NDI_TABLE(is_supported_CPU)
PM_NDI_TABLE(initialize)
PM_NDI_TABLE(version)
PM_NDI_TABLE(destroy)
PM_NDI_TABLE(find_create_v2)
PM_NDI_TABLE(find_get_current_sources)
PM_NDI_TABLE(find_destroy)
PM_NDI_TABLE(recv_create_v2)
PM_NDI_TABLE(recv_destroy)
PM_NDI_TABLE(recv_get_no_connections)
PM_NDI_TABLE(recv_capture_v2)
PM_NDI_TABLE(recv_free_video_v2)
PM_NDI_TABLE(recv_free_audio_v2)
PM_NDI_TABLE(recv_free_metadata)
PM_NDI_TABLE(recv_set_tally)
PM_NDI_TABLE(recv_send_metadata)
PM_NDI_TABLE(recv_ptz_is_supported)
PM_NDI_TABLE(recv_ptz_recall_preset)
PM_NDI_TABLE(recv_ptz_store_preset)
PM_NDI_TABLE(recv_ptz_pan_tilt)
PM_NDI_TABLE(recv_ptz_pan_tilt_speed)
PM_NDI_TABLE(recv_ptz_zoom)
PM_NDI_TABLE(recv_ptz_focus)
PM_NDI_TABLE(recv_ptz_focus_speed)
PM_NDI_TABLE(recv_ptz_auto_focus)
PM_NDI_TABLE(recv_ptz_exposure_auto)
PM_NDI_TABLE(recv_ptz_exposure_manual)
PM_NDI_TABLE(recv_ptz_white_balance_auto)
PM_NDI_TABLE(recv_ptz_white_balance_indoor)
PM_NDI_TABLE(recv_ptz_white_balance_outdoor)
PM_NDI_TABLE(recv_ptz_white_balance_oneshot)
PM_NDI_TABLE(recv_ptz_white_balance_manual)
PM_NDI_TABLE(util_audio_to_interleaved_32f_v2)
#undef PM_NDI_TABLE
// The table has exactly those entries: 33 function pointers.
static_assert(sizeof(TaskNDISource::NdiApi) == 33 * sizeof(void (*)()), "NdiApi gained or lost an entry");

// The comparison itself catches a difference.
static_assert(!Corresponds<void (*)(const ndi_tally*), void (*)(const NDIlib_metadata_frame_t*)>::value);
static_assert(!Corresponds<bool (*)(void*, float), bool (*)(NDIlib_recv_instance_t, int)>::value);
static_assert(!Corresponds<bool (*)(void*), bool (*)(NDIlib_recv_instance_t, float)>::value);

}  // namespace
