#pragma once
// Received sound into a WAV file (32-bit float, interleaved), with libsndfile.
// One thread at a time (the queue's reader thread).
#include <cstdint>
#include <string>

namespace pmhost {

class WavWriter {
 public:
  WavWriter() = default;
  ~WavWriter();
  WavWriter(const WavWriter&) = delete;
  WavWriter& operator=(const WavWriter&) = delete;

  // Opens `path` for `channels` at `rate`. False (logged) on failure.
  bool Open(const std::string& path, int rate, int channels);
  // Interleaved float samples (frames x channels). False when not open.
  bool Write(const float* samples, std::int64_t frames);
  void Close();
  bool IsOpen() const { return file_ != nullptr; }
  int Rate() const { return rate_; }
  int Channels() const { return channels_; }

 private:
  void* file_ = nullptr;  // SNDFILE*
  int rate_ = 0;
  int channels_ = 0;
};

}  // namespace pmhost
