#include "pm-host/wav.h"

#include <sndfile.h>

#include "pm/runtime/log.h"

namespace pmhost {

WavWriter::~WavWriter() { Close(); }

bool WavWriter::Open(const std::string& path, int rate, int channels) {
  Close();
  SF_INFO info{};
  info.samplerate = rate;
  info.channels = channels;
  info.format = SF_FORMAT_WAV | SF_FORMAT_FLOAT;
  SNDFILE* file = sf_open(path.c_str(), SFM_WRITE, &info);
  if (file == nullptr) {
    pm::Log(pm::LogType::Normal, "", "WavWriter: cannot write '%s': %s\n", path.c_str(), sf_strerror(nullptr));
    return false;
  }
  file_ = file;
  rate_ = rate;
  channels_ = channels;
  return true;
}

bool WavWriter::Write(const float* samples, std::int64_t frames) {
  if (file_ == nullptr) return false;
  return sf_writef_float(static_cast<SNDFILE*>(file_), samples, frames) == frames;
}

void WavWriter::Close() {
  if (file_ != nullptr) sf_close(static_cast<SNDFILE*>(file_));
  file_ = nullptr;
}

}  // namespace pmhost
