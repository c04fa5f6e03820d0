#pragma once
// A scripted NDI runtime for the source and discovery tests: an NdiApi table
// of plain functions that act on the ScriptedNdi object currently installed
// (one per test, reached through a process-wide atomic pointer), so a test
// decides what the finder lists, what each capture returns, whether tally and
// metadata sends succeed, and reads back every call the task made.
//
// Thread safety: every member is guarded by one mutex; the receiver or scan
// thread calls the table while the test thread scripts and inspects.

#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "taskndisource/ndi_api.h"

namespace nditest {

// One result of recv_capture_v2, with storage for the data it points at.
struct Capture {
  std::int32_t type = kNdiFrameNone;
  ndi_video_frame_v2 video{};
  ndi_audio_frame_v2 audio{};
  ndi_metadata_frame metadata{};
  std::vector<std::uint8_t> bytes;  // what video.data / audio.data / metadata.data point into
};

// A video frame of `height` lines of `stride` bytes (plus chroma lines for
// NV12), byte (row * 7 + column) & 0xFF.
std::shared_ptr<Capture> VideoCapture(std::uint32_t fourcc, int width, int height, int stride,
                                      std::int64_t timestamp = 0, bool progressive = true);
// Planar float audio: sample s of channel c is c * 1000 + s.
std::shared_ptr<Capture> AudioCapture(int rate, int channels, int samples, std::int64_t timestamp = 0);
// A metadata frame of `text` followed by its terminating zero (length counts it).
std::shared_ptr<Capture> MetadataCapture(const std::string& text);
// A capture result without a frame (status change, error, none).
std::shared_ptr<Capture> TypeOnly(std::int32_t type);

struct ReceiverCreated {
  std::string name;
  std::string url;
  std::int32_t colorFormat = 0;
  std::int32_t bandwidth = 0;
  bool allowFields = true;
};

struct Entry {
  std::optional<std::string> name;
  std::optional<std::string> url;
};

// What the task did to the runtime, as one snapshot.
struct Observed {
  int findersCreated = 0;
  int findersDestroyed = 0;
  int maxLiveFinders = 0;  // most finders alive at one time
  int listCalls = 0;
  std::vector<ReceiverCreated> receivers;
  int receiversDestroyed = 0;
  int connectionQueries = 0;
  std::vector<ndi_tally> tallies;
  std::vector<std::string> metadataSent;  // texts without the terminating zero
  std::vector<int> metadataLengths;       // the lengths passed
  std::vector<std::string> ptzCalls;      // "zoom(0.5)", "recall_preset(3,1)", ...
  int captures = 0;
  int queued = 0;  // captures pushed and not yet handed out
  int frees[3] = {0, 0, 0};  // video, audio, metadata
  bool freesMatched = true;  // every frame handed out was freed, each once
};

class ScriptedNdi {
 public:
  // Installs this object as the one the table's functions act on.
  ScriptedNdi();
  ~ScriptedNdi();
  ScriptedNdi(const ScriptedNdi&) = delete;
  ScriptedNdi& operator=(const ScriptedNdi&) = delete;

  // The table; every entry is filled.
  std::shared_ptr<const TaskNDISource::NdiApi> Api() const;
  Observed Seen();

  // Script.
  void SetSources(std::vector<Entry> entries);
  void FailFinderCreate(bool fail);
  void FailReceiverCreate(bool fail);
  void SetConnections(int count);
  void SetTallyResult(bool ok);
  void SetMetadataResult(bool ok);
  void SetPtzSupported(bool supported);
  // Capture: frames are handed out in order; with none queued a capture
  // waits up to a millisecond (real time) and returns "none". While blocked,
  // a capture waits until unblocked.
  void Push(std::shared_ptr<Capture> capture);
  void BlockCapture(bool block);

  // Called by the table's functions.
  void* FindCreate(const ndi_find_create* settings);
  void FindDestroy(void* finder);
  const ndi_source* FindList(void* finder, std::uint32_t* count);
  void* RecvCreate(const ndi_recv_create* settings);
  void RecvDestroy(void* receiver);
  int Connections(void* receiver);
  std::int32_t Capture(void* receiver, ndi_video_frame_v2* video, ndi_audio_frame_v2* audio,
                       ndi_metadata_frame* metadata, std::uint32_t timeoutMs);
  void Free(int kind, const void* frame);
  bool SetTally(const ndi_tally* tally);
  bool SendMetadata(const ndi_metadata_frame* frame);
  bool PtzSupported();
  bool Ptz(const std::string& call);

 private:
  std::mutex mutex_;  // guards everything below
  std::condition_variable changed_;
  Observed seen_;
  std::vector<Entry> entries_;
  std::vector<ndi_source> list_;  // handed out by FindList, valid until its next call
  bool failFinder_ = false;
  bool failReceiver_ = false;
  int connections_ = 1;
  bool tallyOk_ = true;
  bool metadataOk_ = true;
  bool ptzSupported_ = false;
  std::deque<std::shared_ptr<nditest::Capture>> queue_;
  std::map<const void*, std::shared_ptr<nditest::Capture>> handedOut_;
  bool block_ = false;
  int handles_ = 0;  // handle values are distinct small addresses within this object
  char handleSpace_[64] = {};
};

}  // namespace nditest
