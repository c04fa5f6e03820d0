// A stand-in runtime library for the loader test. Built twice: with
// STUB_RUNTIME_COMPLETE it exports every name the task loads; without, only
// the library calls, so the first finder call is the first missing symbol.
#include "ndi/ndi_abi.h"

#define STUB_EXPORT __attribute__((visibility("default")))

extern "C" {
STUB_EXPORT bool NDIlib_initialize(void) { return true; }
STUB_EXPORT void NDIlib_destroy(void) {}
STUB_EXPORT const char* NDIlib_version(void) { return "stub 1.0"; }
STUB_EXPORT bool NDIlib_is_supported_CPU(void) { return true; }

#ifdef STUB_RUNTIME_COMPLETE
STUB_EXPORT void* NDIlib_find_create_v2(const ndi_find_create*) { return nullptr; }
STUB_EXPORT void NDIlib_find_destroy(void*) {}
STUB_EXPORT const ndi_source* NDIlib_find_get_current_sources(void*, std::uint32_t* count) {
  *count = 0;
  return nullptr;
}
STUB_EXPORT void* NDIlib_recv_create_v2(const ndi_recv_create*) { return nullptr; }
STUB_EXPORT void NDIlib_recv_destroy(void*) {}
STUB_EXPORT int NDIlib_recv_get_no_connections(void*) { return 0; }
STUB_EXPORT std::int32_t NDIlib_recv_capture_v2(void*, ndi_video_frame_v2*, ndi_audio_frame_v2*, ndi_metadata_frame*,
                                                std::uint32_t) {
  return kNdiFrameNone;
}
STUB_EXPORT void NDIlib_recv_free_video_v2(void*, const ndi_video_frame_v2*) {}
STUB_EXPORT void NDIlib_recv_free_audio_v2(void*, const ndi_audio_frame_v2*) {}
STUB_EXPORT void NDIlib_recv_free_metadata(void*, const ndi_metadata_frame*) {}
STUB_EXPORT bool NDIlib_recv_set_tally(void*, const ndi_tally*) { return false; }
STUB_EXPORT bool NDIlib_recv_send_metadata(void*, const ndi_metadata_frame*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_is_supported(void*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_recall_preset(void*, int, float) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_store_preset(void*, int) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_pan_tilt(void*, float, float) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_pan_tilt_speed(void*, float, float) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_zoom(void*, float) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_focus(void*, float) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_focus_speed(void*, float) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_auto_focus(void*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_exposure_auto(void*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_exposure_manual(void*, float) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_white_balance_auto(void*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_white_balance_indoor(void*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_white_balance_outdoor(void*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_white_balance_oneshot(void*) { return false; }
STUB_EXPORT bool NDIlib_recv_ptz_white_balance_manual(void*, float, float) { return false; }
STUB_EXPORT void NDIlib_util_audio_to_interleaved_32f_v2(const ndi_audio_frame_v2*, ndi_audio_frame_interleaved_32f*) {}
#endif
}
