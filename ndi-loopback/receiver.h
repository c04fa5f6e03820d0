#pragma once
// The receiving side of the loopback runtime. One network thread per
// receiver ("ndi-lb receiver") connects and reads frames straight into pooled
// buffers; whole frames go into a bounded queue (the oldest frame of a kind is
// dropped when full) from which Capture hands them out, in the FourCC and
// stride the vendor runtime would deliver for the receiver's colour format
// (picture.h). As with the
// vendor runtime, it connects to the URL it was made for, whichever sender
// listens there, and when nothing answers there to the URL the registry lists
// for its name; after a lost connection it tries again every 150 ms, so a
// sender that comes back at a new URL is found once that URL is listed.
//
// Threads: any thread may call the public operations; the network thread is
// started by the constructor and joined by the destructor.
// Lock order: write_mutex_ and mutex_ are never held together.
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "ndi-loopback/net.h"
#include "ndi-loopback/wire.h"
#include "ndi/ndi_abi.h"

namespace ndilb {

class Receiver {
 public:
  // Depth of the queues between the network and Capture.
  static constexpr int kMaxVideo = 8;
  static constexpr int kMaxAudio = 32;
  static constexpr int kMaxMetadata = 128;
  // How often a disconnected receiver looks for its sender.
  static constexpr int kRetryMs = 150;

  explicit Receiver(const ndi_recv_create& settings);
  ~Receiver();
  Receiver(const Receiver&) = delete;
  Receiver& operator=(const Receiver&) = delete;

  int Connections() const { return connected_.load() ? 1 : 0; }
  std::int32_t Capture(ndi_video_frame_v2* video, ndi_audio_frame_v2* audio, ndi_metadata_frame* metadata,
                       std::uint32_t timeout_ms);
  void FreeVideo(const ndi_video_frame_v2& frame);
  void FreeAudio(const ndi_audio_frame_v2& frame);
  void FreeMetadata(const ndi_metadata_frame& frame);
  bool SetTally(const ndi_tally& tally);
  bool SendMetadata(const ndi_metadata_frame& frame);
  bool PtzSupported() const { return connected_.load() && ptz_.load(); }
  // Sends a PTZ command document; false when not connected. As with the
  // vendor runtime, it goes out whether or not the sender said it takes PTZ.
  bool SendPtz(const std::string& xml);

 private:
  struct Item {
    std::int32_t type = kNdiFrameNone;  // video, audio, metadata or status change
    Message message;
  };

  void Run();
  // The URL the registry lists for the name (empty without one).
  std::string ListedUrl() const;
  // Reads until the connection ends or the receiver stops.
  void Serve(SocketHandle fd);
  void Enqueue(std::unique_ptr<Item> item);
  // Turns a received picture into what the vendor runtime would deliver for
  // this receiver's colour format (FourCC, 16-pixel stride); false when it
  // cannot (the frame is dropped).
  bool Deliverable(Message& message);
  bool WriteMessage(const void* head, std::size_t head_size, const std::string& text);

  const std::string name_;
  const std::string url_;
  const std::int32_t bandwidth_;
  const std::int32_t color_format_;
  const std::shared_ptr<BufferPool> pool_;
  Waker wake_;
  std::atomic<bool> stop_{false};
  // Set when a write on the connection failed: the network thread ends it
  // (a poll does not report our own shutdown everywhere).
  std::atomic<bool> broken_{false};
  std::atomic<bool> connected_{false};
  std::atomic<bool> ptz_{false};
  std::thread thread_;

  std::mutex write_mutex_;  // guards fd_ (for writes; closed under it) and tally_
  SocketHandle fd_ = kNoSocket;
  ndi_tally tally_{false, false};

  mutable std::mutex mutex_;  // guards the queue, the counts and held_
  std::condition_variable cv_;
  std::deque<std::unique_ptr<Item>> queue_;
  int queued_[3] = {0, 0, 0};  // video, audio, metadata items in queue_
  std::map<const void*, std::unique_ptr<Item>> held_;  // captured, not yet freed
};

// A PTZ command as the sender sees it through NDIlib_send_capture, in the
// vendor runtime's words: <ntk_ptz_ELEMENT key="value" .../>, attributes in
// the given order; numbers are printed "%f" (presets as integers).
struct PtzValue {
  const char* key;
  std::string text;
};
PtzValue PtzNumber(const char* key, double value);
PtzValue PtzInteger(const char* key, int value);
std::string PtzXml(const char* element, std::initializer_list<PtzValue> values);

}  // namespace ndilb
