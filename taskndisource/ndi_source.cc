#include "taskndisource/ndi_source.h"

#include <cstdio>
#include <exception>
#include <utility>

#include <tinyxml2.h>

#include "pm/runtime/log.h"
#include "pm/runtime/thread_name.h"
#include "taskndisource/ndi_config.h"

namespace TaskNDISource {

namespace {

// Runs a callable when the scope ends, however it ends.
template <typename F>
class Defer {
 public:
  explicit Defer(F f) : f_(std::move(f)) {}
  ~Defer() { f_(); }
  Defer(const Defer&) = delete;
  Defer& operator=(const Defer&) = delete;

 private:
  F f_;
};

}  // namespace

// The loop's private values, kept from one pass to the next.
struct NDISource::LoopState {
  void* receiver = nullptr;
  void* finder = nullptr;
  std::string url;                 // the receiver was made for it
  std::int64_t nextListLookNs = 0;  // when a receiver's URL is next compared with the list
  bool tallyLive = false;
  bool tallyPreview = false;
  bool tallyDirty = false;
  bool guiDirty = false;
  std::int64_t attempts = 0;
  std::int64_t waitMs = 0;
  ReceiverState wanted = ReceiverState::Connecting;
  ReceiverState lastSeen = ReceiverState::None;
  std::int32_t reported = 0;
  std::int32_t toReport = 0;
  MediaInfo media;
  std::deque<ShotEvent> events;
  std::deque<nlohmann::json> ptz;
  // Copies taken under the mutex at each pass.
  std::uint32_t bandwidth = 100;
  std::int32_t requestedWidth = 0;
  std::int32_t requestedHeight = 0;
  double requestedFrameRate = 0.0;
  Config config;  // the applied configuration, for the status panel
};

NDISource::NDISource(std::shared_ptr<Callbacks> callbacks, std::string uniqueId, std::shared_ptr<const NdiApi> api,
                     LoopEnvironment environment)
    : pm::Source(std::move(callbacks), std::move(uniqueId)),
      api_(std::move(api)),
      env_(CompleteLoopEnvironment(std::move(environment))),
      config_(std::make_unique<Config>()) {}

NDISource::~NDISource() {
  // A source released with its loop still running would leave the loop
  // working on a destroyed object; stop it instead.
  std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
  if (thread_.joinable()) {
    try {
      StopLocked();
    } catch (const std::exception& e) {
      pm::Log(pm::LogType::Normal, kLogTag, "receiver loop ended with an error: %s", e.what());
    } catch (...) {
      pm::LogText(kLogTag, "receiver loop ended with an error");
    }
  }
}

void NDISource::Start() {
  std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
  StartLocked();
}

void NDISource::Stop() {
  std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
  StopLocked();
}

void NDISource::StartLocked() {
  if (thread_.joinable()) {
    pm::LogText(kLogTag, "receiver loop already running");
    return;
  }
  {
    std::lock_guard<std::mutex> guard(mutex_);
    started_ = true;
    loopRunning_ = true;
    eventQueue_.clear();
    ptzQueue_.clear();
  }
  // No loop runs, so the receiver-thread fields are ours until the thread
  // starts.
  producesMask_ = 0;
  timestampBase_ = INT64_MAX;
  resetPending_ = false;
  ptzReported_ = false;
  refusedChannels_ = 0;
  env_.clock->ClearSignals();
  std::promise<void> done;
  loopDone_ = done.get_future();
  thread_ = std::thread([this, done = std::move(done)]() mutable {
    try {
      RunLoop();
      done.set_value();
    } catch (...) {
      done.set_exception(std::current_exception());
    }
  });
}

void NDISource::StopLocked() {
  std::exception_ptr error;
  if (thread_.joinable()) {
    {
      std::lock_guard<std::mutex> guard(mutex_);
      state_ = ReceiverState::Exiting;
    }
    env_.clock->Signal();
    if (loopDone_.wait_for(env_.stopTimeout) != std::future_status::ready) {
      pm::LogText(kLogTag, "failed to exit receiver loop");
      env_.exitProcess();
    }
    thread_.join();
    try {
      loopDone_.get();
    } catch (...) {
      error = std::current_exception();
    }
    loopDone_ = {};
  }
  {
    std::lock_guard<std::mutex> guard(mutex_);
    state_ = ReceiverState::None;
    loopRunning_ = false;
  }
  if (error) std::rethrow_exception(error);
}

void NDISource::Reconnect(const std::function<void()>& action) {
  std::lock_guard<std::mutex> lifecycle(lifecycleMutex_);
  bool started = false;
  {
    std::lock_guard<std::mutex> guard(mutex_);
    started = started_;
  }
  if (started) {
    try {
      StopLocked();
    } catch (const std::exception& e) {
      // The loop is gone either way; the reconnect goes on.
      pm::Log(pm::LogType::Normal, kLogTag, "receiver loop ended with an error: %s", e.what());
    }
  }
  if (action) {
    std::lock_guard<std::mutex> guard(mutex_);
    action();
  }
  if (started) StartLocked();
}

void NDISource::ExecuteCustomActionCommand(std::string command) {
  if (command == kReconnectCommand) Reconnect(nullptr);
}

ReceiverState NDISource::State() {
  std::lock_guard<std::mutex> guard(mutex_);
  return state_;
}

std::uint32_t NDISource::Bandwidth() {
  std::lock_guard<std::mutex> guard(mutex_);
  return bandwidth_;
}

bool NDISource::Started() {
  std::lock_guard<std::mutex> guard(mutex_);
  return started_;
}

MediaInfo NDISource::PublishedMediaInfo() {
  std::lock_guard<std::mutex> guard(mutex_);
  return mediaInfo_;
}

void NDISource::RunLoop() {
  pm::SetThreadName("NDI Receiver");
  LoopState loop;
  Defer cleanup([this, &loop] {
    if (loop.receiver != nullptr) api_->recv_destroy(loop.receiver);
    if (loop.finder != nullptr) api_->find_destroy(loop.finder);
    loop.receiver = nullptr;
    loop.finder = nullptr;
    pm::ClearThreadName();
  });
  for (;;) {
    switch (BeginPass(loop)) {
      case ReceiverState::Exiting:
        return;
      case ReceiverState::Connecting:
        PassConnecting(loop);
        break;
      case ReceiverState::Receiving:
        PassReceiving(loop);
        break;
      case ReceiverState::Idle:
        PassIdle(loop);
        break;
      case ReceiverState::Error:
        PassError(loop);
        break;
      default:
        pm::LogText(kLogTag, "unexpected state in NDI source receiver loop");
        loop.wanted = ReceiverState::Error;
        break;
    }
  }
}

ReceiverState NDISource::BeginPass(LoopState& loop) {
  if (loop.waitMs > 0) {
    env_.clock->WaitUntil(env_.clock->NowNs() + loop.waitMs * 1'000'000);
    loop.waitMs = 0;
  }

  ReceiverState s = ReceiverState::None;
  bool unexpectedExternal = false;
  {
    std::lock_guard<std::mutex> guard(mutex_);
    if (state_ != loop.lastSeen) {
      loop.wanted = state_;
      unexpectedExternal = state_ != ReceiverState::Connecting && state_ != ReceiverState::Exiting;
    }
    if (loop.wanted != loop.lastSeen) {
      state_ = loop.wanted;
      loop.guiDirty = true;
      loop.attempts = 0;
      // Sound of too many channels after the connection came back is told anew.
      if (loop.wanted == ReceiverState::Idle || loop.wanted == ReceiverState::Error) refusedChannels_ = 0;
    }
    s = state_;
    loop.lastSeen = s;

    if (loop.tallyLive != tallyLive_ || loop.tallyPreview != tallyPreview_) {
      loop.tallyLive = tallyLive_;
      loop.tallyPreview = tallyPreview_;
      loop.tallyDirty = true;
    }

    loop.bandwidth = bandwidth_;
    loop.requestedWidth = requestedWidth_;
    loop.requestedHeight = requestedHeight_;
    loop.requestedFrameRate = requestedFrameRate_;
    loop.config.bandwidth = config_->bandwidth.value;

    if (loop.events.empty()) loop.events.swap(eventQueue_);
    if (loop.ptz.empty()) loop.ptz.swap(ptzQueue_);

    if (s != ReceiverState::Receiving) loop.media = MediaInfo{};
    if (mediaInfo_ != loop.media) {
      mediaInfo_ = loop.media;
      loop.guiDirty = true;
    }
  }
  if (unexpectedExternal) pm::LogText(kLogTag, "unexpected external state transition for NDI source");
  if (s == ReceiverState::Exiting) return s;

  const std::shared_ptr<Callbacks>& callbacks = GetCallbacks();
  if (callbacks && loop.guiDirty) {
    callbacks->UpdateGui(BuildStatusGui(loop.config, s), {});
    loop.guiDirty = false;
  }
  if (loop.toReport != loop.reported) {
    // Remembered even without callbacks, so that Idle does not keep asking
    // for an immediate report that can never be made.
    loop.reported = loop.toReport;
    if (callbacks) callbacks->UpdateConnectionState(loop.toReport);
  }
  return s;
}

void NDISource::RetryLater(LoopState& loop) {
  ++loop.attempts;
  loop.waitMs = kRetryWaitMs;
}

void NDISource::AfterDelivery(LoopState& loop) {
  SendShotEvents(loop.receiver, loop.events);
  RunPtzCommands(loop.receiver, loop.ptz);
}

void NDISource::PassConnecting(LoopState& loop) {
  loop.toReport = 1;
  if (loop.receiver != nullptr && ListedElsewhere(loop)) return;
  if (loop.receiver == nullptr && !MakeReceiver(loop)) return;
  if (loop.attempts * kRetryWaitMs >= kConnectLimitMs) {
    loop.wanted = ReceiverState::Idle;
    return;
  }
  const ndi_tally tally{loop.tallyLive, loop.tallyPreview};
  if (!api_->recv_set_tally(loop.receiver, &tally)) return RetryLater(loop);
  loop.tallyDirty = false;
  if (!SendReceiverDocuments(loop.receiver, loop.requestedWidth, loop.requestedHeight, loop.requestedFrameRate)) {
    return RetryLater(loop);
  }
  if (!CaptureOnce(loop.receiver, &loop.media)) {
    ++loop.attempts;  // the capture itself waited
    return;
  }
  loop.attempts = 0;
  loop.wanted = ReceiverState::Receiving;
  AfterDelivery(loop);
}

bool NDISource::MakeReceiver(LoopState& loop) {
  const std::string name = SenderName();
  std::string url;
  if (!FindSourceUrl(loop, name, &url)) {
    loop.wanted = ReceiverState::Error;
    return false;
  }
  if (url.empty()) {
    pm::LogText(kLogTag, "waiting for source to be found");
    RetryLater(loop);
    return false;
  }
  ndi_recv_create settings{};
  settings.source_to_connect_to.ndi_name = name.c_str();
  settings.source_to_connect_to.url_address = url.c_str();
  settings.color_format = kNdiColorUyvyBgra;
  settings.bandwidth = static_cast<std::int32_t>(loop.bandwidth);
  settings.allow_video_fields = false;
  loop.receiver = api_->recv_create_v2(&settings);
  if (loop.receiver == nullptr) {
    pm::LogText(kLogTag, "failed to create NDI receiver\n");
    loop.wanted = ReceiverState::Error;
    return false;
  }
  loop.url = url;
  loop.nextListLookNs = env_.clock->NowNs() + kRetryWaitMs * 1'000'000;
  return true;
}

void NDISource::PassReceiving(LoopState& loop) {
  loop.toReport = 2;
  if (loop.receiver == nullptr) {
    pm::LogText(kLogTag, "expected receiver in receiving state");
    loop.wanted = ReceiverState::Error;
    return;
  }
  if (ListedElsewhere(loop)) {
    loop.wanted = ReceiverState::Connecting;
    return;
  }
  if (loop.tallyDirty) {
    const ndi_tally tally{loop.tallyLive, loop.tallyPreview};
    if (api_->recv_set_tally(loop.receiver, &tally)) loop.tallyDirty = false;
  }
  if (CaptureOnce(loop.receiver, &loop.media)) return AfterDelivery(loop);
  if (api_->recv_get_no_connections(loop.receiver) <= 0) {
    pm::LogText(kLogTag, "lost connection from receiving state\n");
    loop.wanted = ReceiverState::Idle;
  }
}

void NDISource::PassIdle(LoopState& loop) {
  // Report Idle at once, then poll.
  if (loop.reported != 3) {
    loop.toReport = 3;
    loop.waitMs = 0;
  } else {
    loop.waitMs = kPollWaitMs;
  }
  if (loop.receiver != nullptr && api_->recv_get_no_connections(loop.receiver) > 0) {
    pm::LogText(kLogTag, "attempting to reconnect from idle state\n");
    loop.wanted = ReceiverState::Connecting;
    loop.waitMs = 0;
  }
}

void NDISource::PassError(LoopState& loop) {
  if (loop.receiver != nullptr) {
    api_->recv_destroy(loop.receiver);
    loop.receiver = nullptr;
  }
  loop.waitMs = kPollWaitMs;
}

std::string NDISource::SenderName() const {
  const std::string& id = UniqueId();
  return id.size() >= kSourceIdPrefixLength ? id.substr(kSourceIdPrefixLength) : std::string();
}

const ndi_source* NDISource::ListedSource(void* finder, const std::string& name) {
  std::uint32_t count = 0;
  const ndi_source* list = api_->find_get_current_sources(finder, &count);
  if (list == nullptr) return nullptr;
  for (std::uint32_t i = 0; i < count; ++i) {
    if (list[i].ndi_name != nullptr && name == list[i].ndi_name) return &list[i];
  }
  return nullptr;
}

bool NDISource::ListedElsewhere(LoopState& loop) {
  const std::int64_t now = env_.clock->NowNs();
  if (now < loop.nextListLookNs) return false;
  loop.nextListLookNs = now + kRetryWaitMs * 1'000'000;
  const ndi_source* listed = ListedSource(loop.finder, SenderName());
  // A sender that is not listed at all (or without a URL) for a moment keeps
  // its receiver.
  if (listed == nullptr || listed->url_address == nullptr || listed->url_address[0] == '\0' ||
      loop.url == listed->url_address) {
    return false;
  }
  pm::Log(pm::LogType::Normal, kLogTag, "source listed at a new url (%s): making its receiver again", listed->url_address);
  api_->recv_destroy(loop.receiver);
  loop.receiver = nullptr;
  return true;
}

bool NDISource::FindSourceUrl(LoopState& loop, const std::string& name, std::string* url) {
  url->clear();
  if (loop.finder == nullptr) {
    ndi_find_create settings{};
    settings.show_local_sources = true;
    settings.groups = nullptr;
    settings.extra_ips = nullptr;
    loop.finder = api_->find_create_v2(&settings);
    if (loop.finder == nullptr) {
      pm::LogText(kLogTag, "failed to create NDI finder\n");
      return false;
    }
  }
  const ndi_source* listed = ListedSource(loop.finder, name);
  if (listed == nullptr) return true;
  if (listed->url_address != nullptr) *url = listed->url_address;
  if (url->empty()) {
    pm::LogText(kLogTag, "source has no url\n");
    return false;
  }
  return true;
}

bool NDISource::CaptureOnce(void* receiver, MediaInfo* info) {
  ndi_video_frame_v2 video{};
  ndi_audio_frame_v2 audio{};
  ndi_metadata_frame metadata{};
  switch (api_->recv_capture_v2(receiver, &video, &audio, &metadata, kCaptureTimeoutMs)) {
    case kNdiFrameVideo: {
      Defer release([&] { api_->recv_free_video_v2(receiver, &video); });
      return ProcessVideoFrame(video, info);
    }
    case kNdiFrameAudio: {
      Defer release([&] { api_->recv_free_audio_v2(receiver, &audio); });
      return ProcessAudioFrame(audio, info);
    }
    case kNdiFrameMetadata: {
      Defer release([&] { api_->recv_free_metadata(receiver, &metadata); });
      ProcessMetadataFrame(metadata);
      return true;
    }
    case kNdiFrameStatusChange:
      ReportPtzSupport(receiver);
      return false;
    default:
      return false;
  }
}

bool NDISource::SendReceiverDocuments(void* receiver, std::int32_t width, std::int32_t height, double frameRate) {
  tinyxml2::XMLDocument info;
  tinyxml2::XMLElement* infoRoot = info.NewElement("metadata");
  info.InsertEndChild(infoRoot);
  tinyxml2::XMLElement* receiverInfo = info.NewElement("receiver_info");
  receiverInfo->SetAttribute("name", "Skyrelay");
  receiverInfo->SetAttribute("vendor", "Quillfront LLC");
  receiverInfo->SetAttribute("protocol_version", 1);
  infoRoot->InsertEndChild(receiverInfo);
  if (!SendMetadata(receiver, info)) return false;

  char rate[64];
  std::snprintf(rate, sizeof rate, "%.17g", frameRate);
  tinyxml2::XMLDocument settings;
  tinyxml2::XMLElement* settingsRoot = settings.NewElement("metadata");
  settings.InsertEndChild(settingsRoot);
  tinyxml2::XMLElement* media = settings.NewElement("media_settings");
  media->SetAttribute("width", width);
  media->SetAttribute("height", height);
  media->SetAttribute("framerate", rate);
  settingsRoot->InsertEndChild(media);
  return SendMetadata(receiver, settings);
}

}  // namespace TaskNDISource
