#include "taskndisource/ndi_api.h"

#include "pm/runtime/library.h"

namespace TaskNDISource {
namespace {

// Looks `name` up in `handle` and stores it in `slot`; on failure records the
// first missing name.
template <typename Fn>
bool Resolve(void* handle, const char* name, Fn* slot, std::string* missing) {
  void* address = pm::FindSymbol(handle, name);
  if (address == nullptr) {
    if (missing != nullptr) *missing = name;
    return false;
  }
  *slot = reinterpret_cast<Fn>(address);
  return true;
}

}  // namespace

bool LoadNdiApi(const std::string& library, NdiApi* api, std::string* missing) {
  if (api == nullptr) return false;
  *api = NdiApi{};
  // The library stays loaded for the life of the process: the table's
  // pointers are handed to sources and discovery that may outlive any owner
  // we could give the handle.
  void* handle = pm::OpenLibrary(library);
  if (handle == nullptr) {
    if (missing != nullptr) *missing = library;
    return false;
  }
  NdiApi loaded;
  bool ok = true;
#define PM_NDI_RESOLVE(field) ok = ok && Resolve(handle, "NDIlib_" #field, &loaded.field, missing)
  PM_NDI_RESOLVE(is_supported_CPU);
  PM_NDI_RESOLVE(initialize);
  PM_NDI_RESOLVE(version);
  PM_NDI_RESOLVE(destroy);
  PM_NDI_RESOLVE(find_create_v2);
  PM_NDI_RESOLVE(find_get_current_sources);
  PM_NDI_RESOLVE(find_destroy);
  PM_NDI_RESOLVE(recv_create_v2);
  PM_NDI_RESOLVE(recv_destroy);
  PM_NDI_RESOLVE(recv_get_no_connections);
  PM_NDI_RESOLVE(recv_capture_v2);
  PM_NDI_RESOLVE(recv_free_video_v2);
  PM_NDI_RESOLVE(recv_free_audio_v2);
  PM_NDI_RESOLVE(recv_free_metadata);
  PM_NDI_RESOLVE(recv_set_tally);
  PM_NDI_RESOLVE(recv_send_metadata);
  PM_NDI_RESOLVE(recv_ptz_is_supported);
  PM_NDI_RESOLVE(recv_ptz_recall_preset);
  PM_NDI_RESOLVE(recv_ptz_store_preset);
  PM_NDI_RESOLVE(recv_ptz_pan_tilt);
  PM_NDI_RESOLVE(recv_ptz_pan_tilt_speed);
  PM_NDI_RESOLVE(recv_ptz_zoom);
  PM_NDI_RESOLVE(recv_ptz_focus);
  PM_NDI_RESOLVE(recv_ptz_focus_speed);
  PM_NDI_RESOLVE(recv_ptz_auto_focus);
  PM_NDI_RESOLVE(recv_ptz_exposure_auto);
  PM_NDI_RESOLVE(recv_ptz_exposure_manual);
  PM_NDI_RESOLVE(recv_ptz_white_balance_auto);
  PM_NDI_RESOLVE(recv_ptz_white_balance_indoor);
  PM_NDI_RESOLVE(recv_ptz_white_balance_outdoor);
  PM_NDI_RESOLVE(recv_ptz_white_balance_oneshot);
  PM_NDI_RESOLVE(recv_ptz_white_balance_manual);
  PM_NDI_RESOLVE(util_audio_to_interleaved_32f_v2);
#undef PM_NDI_RESOLVE
  if (!ok) return false;
  *api = loaded;
  return true;
}

}  // namespace TaskNDISource
