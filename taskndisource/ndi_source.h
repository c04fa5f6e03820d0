#pragma once
// TaskNDISource::NDISource: one NDI sender as a host source.
//
// Start launches the receiver loop on a thread of its own. The loop finds the
// sender by the NDI name in its unique id ("NDICaptureDevice~" + name),
// creates a receiver, announces itself with two metadata documents, and then
// captures frames until Stop. It is a small state machine:
//
//   Connecting -> Receiving   first frame delivered
//   Connecting -> Idle        120 attempts (30 s at 250 ms) with a receiver
//   Connecting -> Error       no finder, sender listed without URL, no receiver
//   Receiving  -> Idle        nothing captured and 0 connections
//   Receiving  -> Connecting  the finder lists the sender at another URL than
//                             its receiver was made for (looked at every
//                             250 ms, also while connecting): the receiver is
//                             made again for the listed URL. A dead sender's
//                             URL stays listed for a while, and a receiver
//                             takes whichever sender listens at its URL.
//   Idle       -> Connecting  the receiver has a connection again (polled every 5 s)
//   Error                     stays (polled every 5 s) until Stop or a reconnect
//   any        -> Exiting     Stop; the loop ends at its next pass
//
// The host sees states 1, 2 and 3 through UpdateConnectionState and a fresh
// settings panel (UpdateGui) on every state or media format change.
//
// Threads: host request threads call the pm::Source operations; the receiver
// thread runs the loop and is the only thread that calls the NDI runtime and,
// for frames, PTZ suite, build-out and state/GUI reports, the callbacks.
// Stop before destroy: the destructor stops a loop that is still running.
//
// Lock order: lifecycleMutex_ before mutex_. Neither is held across a call
// into the NDI runtime or the callbacks, except that lifecycleMutex_ is held
// while Stop waits for the loop (the loop never takes it).

#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include <nlohmann/json.hpp>

#include "pm/task/source.h"
#include "taskndisource/loop_environment.h"
#include "taskndisource/ndi_api.h"

namespace tinyxml2 {
class XMLDocument;
}

namespace TaskNDISource {

// The unique id of a sender is this prefix followed by its NDI name.
inline constexpr char kSourceIdPrefix[] = "NDICaptureDevice~";
inline constexpr std::size_t kSourceIdPrefixLength = 17;

// The tag of every log line of the NDI source and discovery.
inline constexpr char kLogTag[] = "#ndisource: ";

// Media times count 705,600,000 ticks per second; NDI timestamps count
// 100 ns. d x 100 x 441 / 625, truncated toward zero; saturates instead of
// overflowing for differences beyond about 240 days.
std::int64_t TicksFrom100ns(std::int64_t difference);

enum class ReceiverState : std::uint32_t {
  None = 0,
  Connecting = 1,
  Receiving = 2,
  Idle = 3,
  Error = 4,
  Exiting = 5,
};

// Format of the media being received; all zero when nothing is known.
struct MediaInfo {
  std::int32_t videoWidth = 0;
  std::int32_t videoHeight = 0;
  std::int32_t frameRateN = 0;
  std::int32_t frameRateD = 0;
  std::int32_t audioSampleRate = 0;
  std::int32_t audioChannels = 0;
  bool audioRefused = false;  // the sound has more channels than the host's record carries
  bool operator==(const MediaInfo&) const = default;
};

struct ShotEvent {
  std::string name;
  std::uint8_t preview = 0;
  std::uint8_t live = 0;
};

class NDISource : public pm::Source {
 public:
  struct Config;  // ndi_config.h
  struct Gui;     // ndi_config.h

  // Production timing of the receiver loop.
  static constexpr std::int64_t kRetryWaitMs = 250;     // between attempts while connecting
  static constexpr std::int64_t kPollWaitMs = 5000;     // in Idle and Error
  static constexpr std::int64_t kConnectLimitMs = 30000;  // attempts x 250 ms before Idle
  static constexpr std::uint32_t kCaptureTimeoutMs = 250;

  NDISource(std::shared_ptr<Callbacks> callbacks, std::string uniqueId, std::shared_ptr<const NdiApi> api,
            LoopEnvironment environment = DefaultLoopEnvironment());
  ~NDISource() override;
  NDISource(const NDISource&) = delete;
  NDISource& operator=(const NDISource&) = delete;

  // pm::Source, in slot order.
  void Start() override;
  void Stop() override;
  void SetConfiguration(std::string configJson) override;
  std::string ValidateGui(std::string guiJson) override;
  std::string GuiToConfiguration(std::string guiJson) override;
  std::string ConfigurationToGui(std::string configJson) override;
  void ExecuteCustomActionCommand(std::string command) override;
  void ExecutePtzCommand(const nlohmann::json& request) override;
  void HandleShotEvent(std::string event) override;

  // Stops a running loop, runs `action` (if any) under the mutex and starts
  // again; before the first Start it only runs the action. Start, Stop and
  // Reconnect are serialised: a reconnect never starts a second loop over a
  // running one.
  void Reconnect(const std::function<void()>& action);

  // The settings panel for a configuration and a state, as compact JSON.
  std::string BuildStatusGui(const Config& config, ReceiverState state);

  // Current state as the loop or Stop last wrote it.
  ReceiverState State();
  // Receive bandwidth passed to the next receiver (100, 0 or 10).
  std::uint32_t Bandwidth();
  bool Started();
  MediaInfo PublishedMediaInfo();

  // Frame intake and metadata: receiver thread only (or a test while no loop
  // runs). Each returns true when the frame was delivered to the host.
  bool ProcessVideoFrame(const ndi_video_frame_v2& frame, MediaInfo* info);
  bool ProcessAudioFrame(const ndi_audio_frame_v2& frame, MediaInfo* info);
  void ProcessMetadataFrame(const ndi_metadata_frame& frame);
  void ReportPtzSupport(void* receiver);
  void SendShotEvents(void* receiver, std::deque<ShotEvent>& queue);
  void RunPtzCommands(void* receiver, std::deque<nlohmann::json>& queue);
  bool SendMetadata(void* receiver, const tinyxml2::XMLDocument& document);
  // What the loop has learnt from the sender (receiver thread only).
  const std::string& ModelName() const { return modelName_; }
  std::uint32_t ProducesMask() const { return producesMask_; }

 private:
  // The loop's private values, kept between passes.
  struct LoopState;

  void StartLocked();  // lifecycleMutex_ held
  void StopLocked();   // lifecycleMutex_ held
  void ApplyConfiguration(const std::string& configJson);  // mutex_ held
  void RunLoop();
  // Each pass of the loop: the wait the last pass asked for, then, under the
  // mutex, the state sync (a state written by another thread wins over the
  // loop's wish), tally, queues and published media; then the GUI and
  // connection-state reports. Returns the state to act on (no reports for
  // Exiting).
  ReceiverState BeginPass(LoopState& loop);
  // One function per state, as in the table above.
  // Connecting: find the sender and make its receiver (MakeReceiver), give
  // up to Idle after kConnectLimitMs of attempts, send tally and the two
  // documents, and go to Receiving on the first delivered frame.
  void PassConnecting(LoopState& loop);
  // Receiving: follow a new listed URL, send a changed tally, capture; to
  // Idle when nothing came and the receiver has no connection.
  void PassReceiving(LoopState& loop);
  // Idle: report at once, then poll every kPollWaitMs for a connection.
  void PassIdle(LoopState& loop);
  // Error: drop the receiver and poll every kPollWaitMs until Stop.
  void PassError(LoopState& loop);
  // Connecting without a receiver: true when one was made for the listed
  // URL; otherwise sets the wish (Error) or the retry.
  bool MakeReceiver(LoopState& loop);
  // One more attempt, the next pass after kRetryWaitMs.
  void RetryLater(LoopState& loop);
  // After a delivered frame: pending shot events and PTZ commands.
  void AfterDelivery(LoopState& loop);
  bool FindSourceUrl(LoopState& loop, const std::string& name, std::string* url);
  // The NDI name in the unique id (empty when the id is too short).
  std::string SenderName() const;
  // The first entry of the finder's current list with this name, or null.
  const ndi_source* ListedSource(void* finder, const std::string& name);
  // At most every kRetryWaitMs: when the finder lists the sender at another
  // URL than its receiver was made for, destroys the receiver and returns
  // true (the next Connecting pass makes it for the listed URL).
  bool ListedElsewhere(LoopState& loop);
  // Returns true when a frame was delivered.
  bool CaptureOnce(void* receiver, MediaInfo* info);
  // "receiver_info" then "media_settings"; false when either is not sent.
  bool SendReceiverDocuments(void* receiver, std::int32_t width, std::int32_t height, double frameRate);
  // Timestamp bookkeeping shared by audio and video: updates the base and
  // returns the difference in 100 ns (0 without a timestamp); *reset tells
  // whether the host's clock must be reset before this frame is sent.
  std::int64_t TakeTimestamp(std::int64_t timestamp, bool* reset);
  void MarkProduced(std::uint32_t bit);

  const std::shared_ptr<const NdiApi> api_;
  const LoopEnvironment env_;

  // Held by Start, Stop and Reconnect from beginning to end; guards thread_
  // and loopDone_.
  std::mutex lifecycleMutex_;
  std::thread thread_;
  std::future<void> loopDone_;  // ready when the loop has ended (carries its error)

  // Guards every field below up to the queues: what the request threads share
  // with the loop. Never held across NDI calls or callbacks.
  std::mutex mutex_;
  std::unique_ptr<Config> config_;
  std::uint32_t bandwidth_ = 100;
  bool started_ = false;
  bool loopRunning_ = false;  // between Start and Stop: PTZ commands are queued
  ReceiverState state_ = ReceiverState::None;
  MediaInfo mediaInfo_;
  const std::int32_t requestedWidth_ = 1280;
  const std::int32_t requestedHeight_ = 720;
  const double requestedFrameRate_ = 1.0;
  bool tallyLive_ = false;
  bool tallyPreview_ = false;
  std::deque<ShotEvent> eventQueue_;
  std::deque<nlohmann::json> ptzQueue_;

  // Receiver thread only (reset by Start before the thread begins).
  std::string modelName_;
  bool ptzReported_ = false;  // the last ReportPtzSupport found PTZ supported
  std::uint32_t producesMask_ = 0;
  std::int64_t timestampBase_ = INT64_MAX;
  bool resetPending_ = false;  // a new base was taken; the host's clock is not reset yet
  std::int32_t refusedChannels_ = 0;  // channel count of the sound being refused and told of; 0 while none
};

}  // namespace TaskNDISource
