#pragma once
// The sending side of the loopback runtime: a listening socket on 127.0.0.1,
// a registry entry, and one I/O thread that accepts receivers and reads what
// they send back (hello, tally, metadata). Frames are written by the calling
// thread straight from the caller's memory to each connected receiver.
//
// Threads: any thread may call the public operations; the I/O thread
// ("ndi-lb sender") is started by Create and joined by the destructor.
// Lock order: Sender::mutex_ and a Conn's write_mutex are never held
// together (frame writes copy the connection list under mutex_, release it,
// then take each Conn's lock in turn); at most one Conn lock at a time.
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "ndi-loopback/net.h"
#include "ndi-loopback/wire.h"
#include "ndi/ndi_abi.h"

namespace ndilb {

class Sender {
 public:
  // Null when the socket or the registry entry cannot be made (logged).
  static std::unique_ptr<Sender> Create(const ndi_send_create& settings);
  ~Sender();
  Sender(const Sender&) = delete;
  Sender& operator=(const Sender&) = delete;

  void SendVideo(const ndi_video_frame_v2& frame);
  void SendAudio(const ndi_audio_frame_v2& frame);
  void SendMetadata(const ndi_metadata_frame& frame);
  std::int32_t Capture(ndi_metadata_frame* frame, std::uint32_t timeout_ms);
  void FreeMetadata(const ndi_metadata_frame& frame);
  bool GetTally(ndi_tally* tally, std::uint32_t timeout_ms);
  int GetConnections(std::uint32_t timeout_ms);
  void AddConnectionMetadata(const ndi_metadata_frame& frame);
  void ClearConnectionMetadata();

  const std::string& name() const { return name_; }
  const std::string& url() const { return url_; }

 private:
  struct Conn {
    Conn(SocketHandle f, std::int64_t now_ns) : fd(f), accepted_ns(now_ns), decoder(SenderSideLimits(), nullptr) {}
    std::mutex write_mutex;  // guards fd (for writes and the close) and dead
    SocketHandle fd;
    bool dead = false;
    // Set with dead by a failed write; the I/O thread drops the connection
    // (a poll does not report our own shutdown everywhere).
    std::atomic<bool> broken{false};
    const std::int64_t accepted_ns;  // steady clock
    Decoder decoder;          // I/O thread only
    bool hello = false;       // I/O thread only
    std::int32_t bandwidth = kNdiBandwidthHighest;  // written before `active`
    std::atomic<bool> active{false};
    bool on_program = false;  // guarded by Sender::mutex_
    bool on_preview = false;  // guarded by Sender::mutex_
  };
  struct Held {
    std::unique_ptr<char[]> data;
  };

  Sender() = default;
  void Run();
  void Accept();
  // Reads what is waiting; false when the connection must go.
  bool ReadFrom(Conn& conn);
  bool Handle(Conn& conn, Message& message);
  void Drop(const std::shared_ptr<Conn>& conn);
  // Writes one message to a connection; marks it dead on failure.
  bool WriteTo(Conn& conn, Piece* pieces, int count);
  std::vector<std::shared_ptr<Conn>> ActiveConns();
  void UpdateTallyLocked();
  // The vendor runtime's answer to a receiver's tally, sent to that receiver
  // on connecting and whenever its tally changes:
  // <ndi_tally_echo on_program="true|false" on_preview="true|false"/>.
  bool WriteTallyEcho(Conn& conn, bool on_program, bool on_preview);
  void PaceVideo(const ndi_video_frame_v2& frame);

  std::string name_;
  std::string url_;
  std::string registry_path_;
  bool clock_video_ = false;
  SocketHandle listen_fd_ = kNoSocket;
  Waker wake_;
  std::atomic<bool> stop_{false};
  std::thread thread_;

  std::mutex pace_mutex_;  // guards next_video_ns_
  std::int64_t next_video_ns_ = 0;

  std::mutex mutex_;  // guards everything below
  std::condition_variable cv_;
  std::vector<std::shared_ptr<Conn>> conns_;
  std::vector<std::string> conn_metadata_;
  int active_count_ = 0;
  ndi_tally tally_{false, false};
  // A tally is reported (NDIlib_send_get_tally returns true) at the first
  // look, on every change and, as the vendor runtime does, on every
  // connection change even when the value stays.
  std::uint64_t tally_version_ = 1;
  std::uint64_t tally_reported_ = 0;
  std::deque<std::pair<std::string, std::int64_t>> inbox_;
  std::map<const char*, Held> held_;
};

// The connection metadata by which a sender says that it accepts PTZ
// commands: an <ndi_capabilities> element with ntk_ptz="true". As with the
// vendor runtime, that element is the runtime's own: receivers learn PTZ
// support from it (a status change) and never capture it as metadata.
bool AnnouncesPtz(const std::string& xml);

// Sender's clock for frame stamps: the system's wall clock (since 1970) in
// 100 ns units.
std::int64_t NowTimestamp();

}  // namespace ndilb
