#pragma once
// The task's only way to the NDI runtime: one table of function pointers,
// every call the task makes and nothing more. pmTask_Factory fills it by
// loading the runtime library by name (LoadNdiApi); tests hand sources and
// discovery scripted tables of their own.

#include <string>

#include "ndi/ndi_abi.h"

namespace TaskNDISource {

struct NdiApi {
  decltype(&NDIlib_is_supported_CPU) is_supported_CPU = nullptr;
  decltype(&NDIlib_initialize) initialize = nullptr;
  decltype(&NDIlib_version) version = nullptr;
  decltype(&NDIlib_destroy) destroy = nullptr;

  decltype(&NDIlib_find_create_v2) find_create_v2 = nullptr;
  decltype(&NDIlib_find_get_current_sources) find_get_current_sources = nullptr;
  decltype(&NDIlib_find_destroy) find_destroy = nullptr;

  decltype(&NDIlib_recv_create_v2) recv_create_v2 = nullptr;
  decltype(&NDIlib_recv_destroy) recv_destroy = nullptr;
  decltype(&NDIlib_recv_get_no_connections) recv_get_no_connections = nullptr;
  decltype(&NDIlib_recv_capture_v2) recv_capture_v2 = nullptr;
  decltype(&NDIlib_recv_free_video_v2) recv_free_video_v2 = nullptr;
  decltype(&NDIlib_recv_free_audio_v2) recv_free_audio_v2 = nullptr;
  decltype(&NDIlib_recv_free_metadata) recv_free_metadata = nullptr;
  decltype(&NDIlib_recv_set_tally) recv_set_tally = nullptr;
  decltype(&NDIlib_recv_send_metadata) recv_send_metadata = nullptr;

  decltype(&NDIlib_recv_ptz_is_supported) recv_ptz_is_supported = nullptr;
  decltype(&NDIlib_recv_ptz_recall_preset) recv_ptz_recall_preset = nullptr;
  decltype(&NDIlib_recv_ptz_store_preset) recv_ptz_store_preset = nullptr;
  decltype(&NDIlib_recv_ptz_pan_tilt) recv_ptz_pan_tilt = nullptr;
  decltype(&NDIlib_recv_ptz_pan_tilt_speed) recv_ptz_pan_tilt_speed = nullptr;
  decltype(&NDIlib_recv_ptz_zoom) recv_ptz_zoom = nullptr;
  decltype(&NDIlib_recv_ptz_focus) recv_ptz_focus = nullptr;
  decltype(&NDIlib_recv_ptz_focus_speed) recv_ptz_focus_speed = nullptr;
  decltype(&NDIlib_recv_ptz_auto_focus) recv_ptz_auto_focus = nullptr;
  decltype(&NDIlib_recv_ptz_exposure_auto) recv_ptz_exposure_auto = nullptr;
  decltype(&NDIlib_recv_ptz_exposure_manual) recv_ptz_exposure_manual = nullptr;
  decltype(&NDIlib_recv_ptz_white_balance_auto) recv_ptz_white_balance_auto = nullptr;
  decltype(&NDIlib_recv_ptz_white_balance_indoor) recv_ptz_white_balance_indoor = nullptr;
  decltype(&NDIlib_recv_ptz_white_balance_outdoor) recv_ptz_white_balance_outdoor = nullptr;
  decltype(&NDIlib_recv_ptz_white_balance_oneshot) recv_ptz_white_balance_oneshot = nullptr;
  decltype(&NDIlib_recv_ptz_white_balance_manual) recv_ptz_white_balance_manual = nullptr;

  decltype(&NDIlib_util_audio_to_interleaved_32f_v2) util_audio_to_interleaved_32f_v2 = nullptr;
};

// Loads `library` with dlopen and every entry of the table with dlsym. On
// failure returns false and names what is missing (the library, or the first
// symbol not found) in `missing`; `api` is then left unusable.
bool LoadNdiApi(const std::string& library, NdiApi* api, std::string* missing);

}  // namespace TaskNDISource
