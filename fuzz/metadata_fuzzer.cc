// TaskNDISource::NDISource::ProcessMetadataFrame on a scripted runtime and
// recording callbacks. The frame's `length` bytes are always readable (the
// buffer is allocated at exactly its size, so a read past it is caught), but
// the length may stop before the text's zero, include it, run past it, or
// cover a buffer that has no zero at all.
//
// Input: one mode byte, one length byte, then the metadata text.

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>

#include "fuzz_support.h"
#include "ndi_harness.h"
#include "taskndisource/ndi_source.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  pmfuzz::QuietLog();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  if (size < 2) return 0;
  const std::uint8_t mode = data[0];
  const std::uint8_t lengthByte = data[1];
  const std::uint8_t* text = data + 2;
  const std::size_t textSize = size - 2;

  // The buffer: the text, plus a terminating zero unless the mode says not.
  const bool terminated = (mode & 4u) == 0;
  const std::size_t bufferSize = textSize + (terminated ? 1 : 0);
  if (bufferSize == 0) return 0;
  std::unique_ptr<char[]> buffer(new char[bufferSize]);
  if (textSize > 0) std::memcpy(buffer.get(), text, textSize);
  if (terminated) buffer[textSize] = '\0';

  std::size_t length = bufferSize;
  switch (mode & 3u) {
    case 0: length = bufferSize; break;                                  // all of it
    case 1: length = textSize > 0 ? textSize : bufferSize; break;        // without the zero
    case 2: length = bufferSize - (lengthByte % bufferSize); break;      // shorter
    case 3: length = 1 + lengthByte % bufferSize; break;                  // anywhere in it
  }

  nditest::ScriptedNdi ndi;
  auto callbacks = std::make_shared<nditest::FakeCallbacks>();
  nditest::TestEnvironment env;
  TaskNDISource::NDISource source(callbacks, "NDICaptureDevice~FUZZ (Cam 1)", ndi.Api(), env.Make());
  ndi_metadata_frame frame{};
  frame.length = static_cast<int>(length);
  frame.timecode = 0;
  frame.data = buffer.get();
  source.ProcessMetadataFrame(frame);
  // A second frame on the same source (model name and build-out kept from the first).
  if (mode & 8u) source.ProcessMetadataFrame(frame);
  (void)source.ModelName();
  return 0;
}
