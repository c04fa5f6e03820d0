// ndi-testsrc: an NDI sender of test pictures and sound, written only against
// the NDI C interface (ndi/ndi_abi.h), so that it runs unchanged on
// any runtime that exports it. Every event it sees is one JSON line on stdout.
// With --sizes the picture size changes every --frames-per-size frames (round
// and round through the list), each change announced as
// {"event":"size","width":W,"height":H,"frame":N} before frame N goes out.
#include <tinyxml2.h>

#include <CLI/CLI.hpp>
#include <atomic>
#include <chrono>
#include <cmath>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <memory>
#include <optional>
#include <mutex>
#include <numbers>
#include <nlohmann/json.hpp>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "ndi-testsrc/pattern.h"
#include "ndi/ndi_abi.h"
#include "pm/runtime/system.h"

namespace {

std::atomic<bool> g_stop{false};

void OnSignal(int) { g_stop = true; }

struct Options {
  std::string name;
  int width = 1280;
  int height = 720;
  std::string fps = "30/1";
  std::string format = "uyvy";
  std::string pattern = "bars";
  int audio_rate = 48000;
  int audio_channels = 2;
  int audio_samples = 0;  // 0: one video frame's worth
  bool no_audio = false;
  bool ptz = false;
  std::string model;
  std::int64_t frames = -1;
  double seconds = -1;
  std::string sizes;          // "WxH,WxH,...": a sequence of picture sizes
  int frames_per_size = 30;   // frames of each size before the next one
};

std::mutex g_out_mutex;  // guards stdout
void Emit(const nlohmann::json& event) {
  const std::string line = event.dump() + "\n";
  std::lock_guard<std::mutex> lock(g_out_mutex);
  std::fwrite(line.data(), 1, line.size(), stdout);
  std::fflush(stdout);
}

bool ParseRate(const std::string& text, int* n, int* d) {
  int a = 0, b = 1;
  char slash = 0;
  const int got = std::sscanf(text.c_str(), "%d%c%d", &a, &slash, &b);
  if (got == 1) b = 1;
  else if (got != 3 || slash != '/') return false;
  if (a < 0 || b <= 0) return false;
  *n = a;
  *d = b;
  return true;
}

std::string UpperHost() {
  std::string s = pm::HostName();
  for (char& c : s) c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return s;
}

// Our own URL, as discovery sees it: the entry of our name that was not there
// before the sender was made.
std::string FindOwnUrl(const std::string& full_name, const std::set<std::string>& before) {
  ndi_find_create settings{true, nullptr, nullptr};
  void* finder = NDIlib_find_create_v2(&settings);
  if (finder == nullptr) return {};
  std::string url;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(2);
  while (url.empty() && std::chrono::steady_clock::now() < deadline) {
    std::uint32_t count = 0;
    const ndi_source* sources = NDIlib_find_get_current_sources(finder, &count);
    for (std::uint32_t i = 0; i < count; ++i) {
      if (sources[i].ndi_name == nullptr || sources[i].url_address == nullptr) continue;
      if (full_name == sources[i].ndi_name && before.count(sources[i].url_address) == 0) url = sources[i].url_address;
    }
    if (url.empty()) NDIlib_find_wait_for_sources(finder, 100);
  }
  NDIlib_find_destroy(finder);
  return url;
}

std::set<std::string> UrlsOf(const std::string& full_name) {
  std::set<std::string> urls;
  ndi_find_create settings{true, nullptr, nullptr};
  void* finder = NDIlib_find_create_v2(&settings);
  if (finder == nullptr) return urls;
  std::uint32_t count = 0;
  const ndi_source* sources = NDIlib_find_get_current_sources(finder, &count);
  for (std::uint32_t i = 0; i < count; ++i) {
    if (sources[i].ndi_name != nullptr && sources[i].url_address != nullptr && full_name == sources[i].ndi_name) {
      urls.insert(sources[i].url_address);
    }
  }
  NDIlib_find_destroy(finder);
  return urls;
}

// One metadata text from a receiver: a PTZ command (an <ntk_ptz_NAME .../>
// element, reported as command NAME with its attributes, numbers as numbers)
// or plain metadata.
void ReportMetadata(const std::string& xml) {
  static constexpr char kPtzPrefix[] = "ntk_ptz_";
  tinyxml2::XMLDocument doc;
  if (doc.Parse(xml.c_str(), xml.size()) == tinyxml2::XML_SUCCESS && doc.RootElement() != nullptr &&
      std::strncmp(doc.RootElement()->Name(), kPtzPrefix, sizeof kPtzPrefix - 1) == 0) {
    const tinyxml2::XMLElement* root = doc.RootElement();
    nlohmann::json values = nlohmann::json::object();
    for (const tinyxml2::XMLAttribute* a = root->FirstAttribute(); a != nullptr; a = a->Next()) {
      double v = 0;
      if (a->QueryDoubleValue(&v) == tinyxml2::XML_SUCCESS) {
        values[a->Name()] = v;
      } else {
        values[a->Name()] = a->Value();
      }
    }
    Emit({{"event", "ptz"}, {"command", root->Name() + sizeof kPtzPrefix - 1}, {"values", values}, {"xml", xml}});
    return;
  }
  Emit({{"event", "metadata"}, {"xml", xml}});
}

// Reports what receivers send back until `done`.
void WatchEvents(void* sender, const std::atomic<bool>& done) {
  int connections = 0;
  while (!done) {
    ndi_metadata_frame frame{};
    if (NDIlib_send_capture(sender, &frame, 20) == kNdiFrameMetadata) {
      std::string xml;
      if (frame.data != nullptr && frame.length > 0) {
        xml.assign(frame.data, ::strnlen(frame.data, static_cast<std::size_t>(frame.length)));
      }
      NDIlib_send_free_metadata(sender, &frame);
      ReportMetadata(xml);
    }
    ndi_tally tally{};
    if (NDIlib_send_get_tally(sender, &tally, 0)) {
      Emit({{"event", "tally"}, {"program", tally.on_program}, {"preview", tally.on_preview}});
    }
    const int now = NDIlib_send_get_no_connections(sender, 0);
    if (now != connections) {
      connections = now;
      Emit({{"event", "connections"}, {"count", now}});
    }
  }
}

// What one video frame looks like. Kept per frame so that a stream can
// change its size mid-way (--sizes).
struct Geometry {
  std::uint32_t fourcc = 0;
  int width = 0;
  int height = 0;
  bool operator==(const Geometry&) const = default;
};

// "1920x1080,1280x720": the sizes in order; empty when the text is not such a
// list or a size is out of range.
std::vector<Geometry> ParseSizes(const std::string& text, std::uint32_t fourcc) {
  std::vector<Geometry> sizes;
  std::size_t at = 0;
  while (at <= text.size()) {
    const std::size_t comma = std::min(text.find(',', at), text.size());
    const std::string item = text.substr(at, comma - at);
    int w = 0, h = 0;
    char x = 0, extra = 0;
    if (std::sscanf(item.c_str(), "%d%c%d%c", &w, &x, &h, &extra) != 3 || (x != 'x' && x != 'X') || w < 2 ||
        h < 2 || w > 16384 || h > 16384) {
      return {};
    }
    sizes.push_back({fourcc, w, h});
    at = comma + 1;
  }
  return sizes;
}

// The picture of one geometry: its planes, its memory and, for the bars
// pattern, its bars.
struct Picture {
  Picture(const Geometry& g, bool with_bars, bool blocks)
      : geometry(g), planes(ndits::PictureLayout(g.fourcc, g.width, g.height)) {
    bytes.resize(ndits::PictureSize(planes));
    if (with_bars) bars.emplace(g.fourcc, g.width, g.height, blocks);
  }
  Geometry geometry;
  std::vector<ndits::Plane> planes;
  std::vector<std::uint8_t> bytes;
  std::optional<ndits::Bars> bars;
};

int Run(const Options& o) {
  int rate_n = 0, rate_d = 1;
  if (!ParseRate(o.fps, &rate_n, &rate_d)) {
    std::fprintf(stderr, "ndi-testsrc: bad --fps %s (N or N/D)\n", o.fps.c_str());
    return 2;
  }
  const std::uint32_t fourcc = ndits::FourCCFromName(o.format);
  std::vector<Geometry> sizes{{fourcc, o.width, o.height}};
  if (!o.sizes.empty()) {
    sizes = ParseSizes(o.sizes, fourcc);
    if (sizes.empty()) {
      std::fprintf(stderr, "ndi-testsrc: bad --sizes %s (WxH,WxH,...)\n", o.sizes.c_str());
      return 2;
    }
  }
  for (const Geometry& g : sizes) {
    if (ndits::PictureLayout(g.fourcc, g.width, g.height).empty()) {
      std::fprintf(stderr, "ndi-testsrc: %s cannot be %dx%d\n", o.format.c_str(), g.width, g.height);
      return 2;
    }
  }
  const bool ramp = o.pattern == "ramp";
  const bool blocks = o.pattern == "blocks";
  const bool ramp_sound = ramp || blocks;
  int audio_samples = o.audio_samples;
  if (audio_samples <= 0) {
    audio_samples = rate_n > 0 ? static_cast<int>(static_cast<std::int64_t>(o.audio_rate) * rate_d / rate_n) : 1600;
    audio_samples = std::max(1, audio_samples);
  }

  if (!NDIlib_initialize()) {
    std::fprintf(stderr, "ndi-testsrc: the NDI runtime did not initialise\n");
    return 1;
  }
  const std::string full_name = UpperHost() + " (" + o.name + ")";
  const std::set<std::string> before = UrlsOf(full_name);
  ndi_send_create settings{o.name.c_str(), nullptr, rate_n > 0, false};
  void* sender = NDIlib_send_create(&settings);
  if (sender == nullptr) {
    std::fprintf(stderr, "ndi-testsrc: cannot create the sender\n");
    NDIlib_destroy();
    return 1;
  }
  auto add_connection_metadata = [&](const std::string& xml) {
    std::vector<char> text(xml.begin(), xml.end());
    text.push_back('\0');
    ndi_metadata_frame frame{static_cast<int>(text.size()), kNdiSendTimecodeSynthesize, text.data()};
    NDIlib_send_add_connection_metadata(sender, &frame);
  };
  if (!o.model.empty()) {
    tinyxml2::XMLDocument doc;
    tinyxml2::XMLElement* product = doc.NewElement("ndi_product");
    product->SetAttribute("model_name", o.model.c_str());
    doc.InsertFirstChild(product);
    tinyxml2::XMLPrinter printer(nullptr, true);
    doc.Print(&printer);
    add_connection_metadata(printer.CStr());
  }
  if (o.ptz) add_connection_metadata("<ndi_capabilities ntk_ptz=\"true\"/>");

  Emit({{"event", "ready"}, {"name", full_name}, {"url", FindOwnUrl(full_name, before)}});

  std::atomic<bool> done{false};
  std::thread events([&] { WatchEvents(sender, done); });

  // The sizes follow each other every frames_per_size frames, round and
  // round; each change is reported before its first frame goes out.
  std::unique_ptr<Picture> picture;
  const int channels = o.audio_channels;
  const int channel_stride = (audio_samples + 16) * 4;  // padded apart, as capture cards do
  std::vector<float> audio(static_cast<std::size_t>(channel_stride / 4) * channels);
  std::int64_t samples_sent = 0;

  const auto start = std::chrono::steady_clock::now();
  std::int64_t n = 0;
  while (!g_stop) {
    if (o.frames >= 0 && n >= o.frames) break;
    if (o.seconds >= 0 && std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count() >= o.seconds) {
      break;
    }
    if (!o.no_audio && channels > 0) {
      // Sound keeps pace with the pictures: everything due by the end of frame n.
      const std::int64_t due = rate_n > 0 ? (n + 1) * o.audio_rate * rate_d / rate_n : samples_sent + audio_samples;
      while (samples_sent + audio_samples <= due) {
        for (int c = 0; c < channels; ++c) {
          float* out = audio.data() + static_cast<std::size_t>(c) * (channel_stride / 4);
          for (int s = 0; s < audio_samples; ++s) {
            const std::int64_t t = samples_sent + s;
            out[s] = ramp_sound ? ndits::AudioRampSample(t, c)
                          : 0.25f * static_cast<float>(std::sin(2.0 * std::numbers::pi * 1000.0 * static_cast<double>(t) / o.audio_rate));
          }
        }
        ndi_audio_frame_v2 frame{};
        frame.sample_rate = o.audio_rate;
        frame.no_channels = channels;
        frame.no_samples = audio_samples;
        frame.timecode = kNdiSendTimecodeSynthesize;
        frame.data = audio.data();
        frame.channel_stride_in_bytes = channel_stride;
        NDIlib_send_send_audio_v2(sender, &frame);
        samples_sent += audio_samples;
      }
    }
    const std::int64_t turn = (n / o.frames_per_size) % static_cast<std::int64_t>(sizes.size());
    const Geometry& geometry = sizes[static_cast<std::size_t>(turn)];
    if (!picture || !(picture->geometry == geometry)) {
      picture.reset();  // a 2160p picture is 16 MB: never two at once
      picture = std::make_unique<Picture>(geometry, !ramp, blocks);
      Emit({{"event", "size"}, {"width", geometry.width}, {"height", geometry.height}, {"frame", n}});
    }
    if (ramp) {
      ndits::FillRamp(picture->planes, n, picture->bytes.data());
    } else {
      picture->bars->Fill(n, picture->bytes.data());
    }
    ndi_video_frame_v2 frame{};
    frame.xres = geometry.width;
    frame.yres = geometry.height;
    frame.FourCC = geometry.fourcc;
    frame.frame_rate_N = rate_n > 0 ? rate_n : 60;
    frame.frame_rate_D = rate_n > 0 ? rate_d : 1;
    frame.picture_aspect_ratio = static_cast<float>(geometry.width) / static_cast<float>(geometry.height);
    frame.frame_format_type = kNdiFrameFormatProgressive;
    frame.timecode = kNdiSendTimecodeSynthesize;
    frame.data = picture->bytes.data();
    frame.line_stride_in_bytes = picture->planes[0].stride;
    NDIlib_send_send_video_v2(sender, &frame);  // paced by the runtime when clock_video is set
    ++n;
  }

  done = true;
  events.join();
  NDIlib_send_destroy(sender);  // removes the sender from discovery
  NDIlib_destroy();
  Emit({{"event", "exit"}, {"frames", n}});
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  CLI::App app{"ndi-testsrc: an NDI sender of test pictures and sound; every event it sees is a JSON line on stdout.\n"
               "Exit status: 0 success, 1 the sender failed, 2 a usage error."};
  app.set_version_flag("--version", "ndi-testsrc " PM_VERSION);
  app.option_defaults()->always_capture_default();
  app.add_option("--name", o.name, "NDI source name (the part in parentheses)")->required();
  app.add_option("--width", o.width, "picture width")->check(CLI::Range(2, 16384));
  app.add_option("--height", o.height, "picture height")->check(CLI::Range(2, 16384));
  app.add_option("--fps", o.fps, "frame rate N or N/D; 0 = as fast as possible");
  app.add_option("--format", o.format, "picture format")
      ->check(CLI::IsMember({"uyvy", "uyva", "nv12", "i420", "yv12", "bgra", "bgrx", "rgba", "rgbx"}));
  app.add_option("--pattern", o.pattern, "test pattern")->check(CLI::IsMember({"bars", "ramp", "blocks"}));
  app.add_option("--audio-rate", o.audio_rate, "audio sample rate")->check(CLI::Range(1, 384000));
  app.add_option("--audio-channels", o.audio_channels, "audio channels")->check(CLI::Range(1, 1024));
  app.add_option("--audio-samples", o.audio_samples, "samples per audio frame")
      ->check(CLI::Range(1, 1 << 20))
      ->default_str("one picture's worth");
  app.add_flag("--no-audio", o.no_audio, "send no audio");
  app.add_flag("--ptz", o.ptz, "accept PTZ commands (reported as events)");
  app.add_option("--model", o.model, "model name sent as connection metadata");
  auto* frames = app.add_option("--frames", o.frames, "send N video frames, then exit")
                     ->check(CLI::NonNegativeNumber)
                     ->default_str("until interrupted");
  auto* seconds = app.add_option("--seconds", o.seconds, "run S seconds, then exit")
                      ->check(CLI::NonNegativeNumber)
                      ->default_str("until interrupted");
  frames->excludes(seconds);
  app.add_option("--sizes", o.sizes, "picture sizes WxH,WxH,... in turn (instead of --width/--height)");
  app.add_option("--frames-per-size", o.frames_per_size, "frames of each of --sizes before the next")
      ->check(CLI::Range(1, 1 << 30));
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return app.exit(e) == 0 ? 0 : 2;  // help and --version: 0; a mistake on the line: 2
  }

  std::signal(SIGTERM, OnSignal);
  std::signal(SIGINT, OnSignal);  // also Ctrl-C in a Windows console
  return Run(o);
}
