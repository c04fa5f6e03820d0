// Writing pictures into a shared-memory segment: CopyFrame from a source with
// a different stride and ConvertFrame I420 -> NV12, each against a plain
// memcpy of the same byte count into the same segment, measured in the same
// run. Prints the ratios at the end.

#include <benchmark/benchmark.h>

#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "pm/shm/formats.h"
#include "pm/shm/shared_cpu_memory_posix.h"
#include "pm/task/buffers.h"

namespace {

pm::VideoFormat Format(std::uint32_t code, int width, int height) {
  pm::VideoFormat f;
  f.code = code;
  f.width = static_cast<std::int16_t>(width);
  f.height = static_cast<std::int16_t>(height);
  return f;
}

// A video buffer over a segment, mapped the way the source buffers map theirs.
class SegmentVideoBuffer : public pm::VideoBuffer {
 public:
  SegmentVideoBuffer(pm::VideoFormat format, std::int32_t stride) : format_(format) {
    segment_ = pm::SharedCpuMemoryPosix::New();
    const std::uint64_t size = (static_cast<std::uint64_t>(pm::FrameSize(format, stride)) + 4095) / 4096 * 4096;
    if (!segment_->Create(std::nullopt, size)) std::abort();
    segment_->descriptor.stride = static_cast<std::uint32_t>(stride);
    std::memset(segment_->Data(), 0, size);  // fault the pages in before timing
  }
  pm::VideoPlanes Planes() override {
    const auto [data, stride] = segment_->Lock();
    return pm::LayoutPlanes(format_, data, stride);
  }
  std::pair<std::uint8_t*, std::int32_t> MapData() override { return segment_->Lock(); }
  void UnmapData() override { segment_->Unlock(); }
  pm::VideoFormat Format() const override { return format_; }
  std::uint8_t* Data() { return segment_->Data(); }

 private:
  pm::VideoFormat format_;
  std::shared_ptr<pm::SharedCpuMemoryPosix> segment_;
};

std::vector<std::uint8_t> Filled(std::size_t n) {
  std::vector<std::uint8_t> v(n);
  for (std::size_t i = 0; i < n; ++i) v[i] = static_cast<std::uint8_t>(i * 7);
  return v;
}

void Memcpy(benchmark::State& state, std::size_t bytes) {
  SegmentVideoBuffer buffer(Format(pm::kCodeRgba, 1024, static_cast<int>((bytes + 4095) / 4096)), 0);
  const std::vector<std::uint8_t> source = Filled(bytes);
  for (auto _ : state) {
    std::memcpy(buffer.Data(), source.data(), bytes);
    benchmark::ClobberMemory();
  }
  state.SetBytesProcessed(static_cast<std::int64_t>(state.iterations() * bytes));
}

void CopyFrame2vuy(benchmark::State& state, int width, int height) {
  const pm::VideoFormat f = Format(pm::kCode2vuy, width, height);
  const std::int32_t sourceStride = pm::DefaultStride(f) + 128;  // differs from the segment's
  SegmentVideoBuffer buffer(f, pm::DefaultStride(f));
  const std::vector<std::uint8_t> source = Filled(static_cast<std::size_t>(sourceStride) * height);
  for (auto _ : state) {
    buffer.CopyFrame(source.data(), sourceStride);
    benchmark::ClobberMemory();
  }
  state.SetBytesProcessed(state.iterations() * pm::FrameSize(f, 0));
}

void ConvertI420(benchmark::State& state, int width, int height) {
  const pm::VideoFormat f = Format(pm::kCodeNV12, width, height);
  SegmentVideoBuffer buffer(f, width);
  std::vector<std::uint8_t> y = Filled(static_cast<std::size_t>(width) * height);
  std::vector<std::uint8_t> u = Filled(static_cast<std::size_t>(width / 2) * (height / 2));
  std::vector<std::uint8_t> v = Filled(static_cast<std::size_t>(width / 2) * (height / 2));
  pm::VideoPlanes planes;
  planes.planeCount = 3;
  planes.plane[0] = {y.data(), height, width};
  planes.plane[1] = {u.data(), height / 2, width / 2};
  planes.plane[2] = {v.data(), height / 2, width / 2};
  for (auto _ : state) {
    buffer.ConvertFrame(pm::kCodeI420, planes);
    benchmark::ClobberMemory();
  }
  state.SetBytesProcessed(state.iterations() * pm::FrameSize(f, 0));
}

struct Comparison {
  const char* subject;
  const char* baseline;
  double goal;  // 0: no goal for this pair on its own
};
constexpr Comparison kComparisons[] = {
    {"ConvertFrame/I420toNV12/1080p", "Memcpy/3110400", 1.5},
    {"CopyFrame/2vuy/1080p", "Memcpy/4147200", 0},
    {"CopyFrame/2vuy/2160p", "Memcpy/16588800", 0},
};

// The console report, plus the time per iteration of each benchmark for the
// ratios printed at the end.
class RatioReporter : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    ConsoleReporter::ReportRuns(runs);
    // With repetitions the median stands for the benchmark.
    for (const Run& run : runs) {
      if (run.error_occurred) continue;
      if (run.run_type == Run::RT_Iteration || run.aggregate_name == "median")
        realTime_[run.run_name.function_name] = run.GetAdjustedRealTime();
    }
  }
  void PrintRatios() const {
    for (const Comparison& c : kComparisons) {
      const auto s = realTime_.find(c.subject);
      const auto b = realTime_.find(c.baseline);
      if (s == realTime_.end() || b == realTime_.end() || b->second <= 0) continue;
      const double ratio = s->second / b->second;
      if (c.goal > 0) {
        std::printf("ratio %s / %s = %.2f (goal <= %.2f: %s)\n", c.subject, c.baseline, ratio, c.goal,
                    ratio <= c.goal ? "met" : "MISSED");
      } else {
        std::printf("ratio %s / %s = %.2f\n", c.subject, c.baseline, ratio);
      }
    }
  }

 private:
  std::map<std::string, double> realTime_;
};

}  // namespace

int main(int argc, char** argv) {
  benchmark::RegisterBenchmark("Memcpy/3110400", Memcpy, std::size_t{1920 * 1080 * 3 / 2})->UseRealTime();
  benchmark::RegisterBenchmark("ConvertFrame/I420toNV12/1080p", ConvertI420, 1920, 1080)->UseRealTime();
  benchmark::RegisterBenchmark("Memcpy/4147200", Memcpy, std::size_t{3840 * 1080})->UseRealTime();
  benchmark::RegisterBenchmark("CopyFrame/2vuy/1080p", CopyFrame2vuy, 1920, 1080)->UseRealTime();
  benchmark::RegisterBenchmark("Memcpy/16588800", Memcpy, std::size_t{7680 * 2160})->UseRealTime();
  benchmark::RegisterBenchmark("CopyFrame/2vuy/2160p", CopyFrame2vuy, 3840, 2160)->UseRealTime();
  benchmark::Initialize(&argc, argv);
  RatioReporter reporter;
  benchmark::RunSpecifiedBenchmarks(&reporter);
  reporter.PrintRatios();
  benchmark::Shutdown();
  return 0;
}
