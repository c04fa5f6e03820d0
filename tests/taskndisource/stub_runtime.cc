// A stand-in runtime library for the loader and factory tests. Built twice:
// with STUB_RUNTIME_COMPLETE it exports every name the task loads; without,
// only the library calls, so the first finder call is the first missing
// symbol. Only the library calls are ever called; the others exist to be
// found.
#define STUB_EXPORT extern "C" __attribute__((visibility("default")))

STUB_EXPORT bool NDIlib_initialize(void) { return true; }
STUB_EXPORT void NDIlib_destroy(void) {}
STUB_EXPORT const char* NDIlib_version(void) { return "stub 1.0"; }
STUB_EXPORT bool NDIlib_is_supported_CPU(void) { return true; }

#ifdef STUB_RUNTIME_COMPLETE
#define STUB(name) STUB_EXPORT void NDIlib_##name(void) {}
STUB(find_create_v2)
STUB(find_destroy)
STUB(find_get_current_sources)
STUB(recv_create_v2)
STUB(recv_destroy)
STUB(recv_get_no_connections)
STUB(recv_capture_v2)
STUB(recv_free_video_v2)
STUB(recv_free_audio_v2)
STUB(recv_free_metadata)
STUB(recv_set_tally)
STUB(recv_send_metadata)
STUB(recv_ptz_is_supported)
STUB(recv_ptz_recall_preset)
STUB(recv_ptz_store_preset)
STUB(recv_ptz_pan_tilt)
STUB(recv_ptz_pan_tilt_speed)
STUB(recv_ptz_zoom)
STUB(recv_ptz_focus)
STUB(recv_ptz_focus_speed)
STUB(recv_ptz_auto_focus)
STUB(recv_ptz_exposure_auto)
STUB(recv_ptz_exposure_manual)
STUB(recv_ptz_white_balance_auto)
STUB(recv_ptz_white_balance_indoor)
STUB(recv_ptz_white_balance_outdoor)
STUB(recv_ptz_white_balance_oneshot)
STUB(recv_ptz_white_balance_manual)
STUB(util_audio_to_interleaved_32f_v2)
#endif
