// The loopback runtime's pieces that need no socket: the wire decoder, the
// registry entry format, picture halving and the audio interleaving call.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstring>
#include <vector>

#include "ndi-loopback/picture.h"
#include "ndi-testsrc/pattern.h"
#include "ndi-loopback/registry.h"
#include "ndi-loopback/wire.h"
#include "ndi/ndi_abi.h"

namespace {

using ndilb::Decoder;
using ndilb::MessageType;

std::vector<std::uint8_t> VideoBytes(int w, int h, std::uint8_t fill, const std::string& text = "") {
  ndilb::VideoInfo info;
  info.xres = w;
  info.yres = h;
  info.fourcc = kNdiFourCCUYVY;
  info.frame_rate_N = 30;
  info.frame_rate_D = 1;
  info.line_stride = w * 2;
  info.timestamp = 1234567;
  const std::size_t payload = static_cast<std::size_t>(w) * 2 * h;
  ndilb::EncodedHead head = ndilb::EncodeVideo(info, static_cast<std::uint32_t>(text.size()), payload);
  std::vector<std::uint8_t> bytes(head.bytes, head.bytes + head.size);
  bytes.insert(bytes.end(), text.begin(), text.end());
  bytes.insert(bytes.end(), payload, fill);
  return bytes;
}

std::vector<std::uint8_t> MetadataBytes(const std::string& text, MessageType type = MessageType::Metadata) {
  ndilb::EncodedHead head = ndilb::EncodeMetadata(type, 42, static_cast<std::uint32_t>(text.size()));
  std::vector<std::uint8_t> bytes(head.bytes, head.bytes + head.size);
  bytes.insert(bytes.end(), text.begin(), text.end());
  return bytes;
}

Decoder ReceiverDecoder() { return Decoder(ndilb::ReceiverSideLimits(), std::make_shared<ndilb::BufferPool>(2)); }

TEST(WireDecoder, WholeMessagesComeOutWhateverTheFragmentation) {
  std::vector<std::uint8_t> stream = VideoBytes(8, 4, 0xAB, "<frame/>");
  const auto meta = MetadataBytes("<hello/>");
  stream.insert(stream.end(), meta.begin(), meta.end());
  for (std::size_t chunk : {stream.size(), std::size_t{1}, std::size_t{7}, std::size_t{25}}) {
    Decoder d = ReceiverDecoder();
    std::size_t messages = 0;
    for (std::size_t at = 0; at < stream.size(); at += chunk) {
      const std::size_t n = std::min(chunk, stream.size() - at);
      ASSERT_TRUE(d.Feed(stream.data() + at, n)) << d.error();
      while (auto m = d.Pop()) {
        ++messages;
        if (m->type == MessageType::Video) {
          // Never handed out before its last byte arrived.
          EXPECT_GE(at + n, VideoBytes(8, 4, 0xAB, "<frame/>").size());
          EXPECT_EQ(m->video.xres, 8);
          EXPECT_EQ(m->video.timestamp, 1234567);
          EXPECT_EQ(m->text, "<frame/>");
          ASSERT_EQ(m->payload.size(), 64u);
          for (std::size_t i = 0; i < 64; ++i) ASSERT_EQ(m->payload.data()[i], 0xAB);
        } else {
          EXPECT_EQ(m->type, MessageType::Metadata);
          EXPECT_EQ(m->text, "<hello/>");
          EXPECT_EQ(m->timecode, 42);
          EXPECT_EQ(at + n, stream.size());
        }
      }
    }
    EXPECT_EQ(messages, 2u) << "chunk " << chunk;
  }
}

std::vector<std::uint8_t> AudioBytes(int channels, int samples, std::uint64_t payload) {
  ndilb::AudioInfo info;
  info.sample_rate = 48000;
  info.channels = channels;
  info.samples = samples;
  ndilb::EncodedHead head = ndilb::EncodeAudio(info, 0, payload);
  return {head.bytes, head.bytes + head.size};
}

TEST(WireDecoder, RejectsBadHeadersBeforeAllocatingAndStaysFailed) {
  auto spoilt = [](void (*spoil)(std::vector<std::uint8_t>&)) {
    std::vector<std::uint8_t> bytes = VideoBytes(8, 4, 1);
    spoil(bytes);
    return bytes;
  };
  const std::pair<const char*, std::vector<std::uint8_t>> cases[] = {
      {"magic", spoilt([](auto& b) { b[0] ^= 0xFF; })},
      {"type", spoilt([](auto& b) { b[4] = 99; })},
      {"info size", spoilt([](auto& b) { b[6] = 47; })},
      {"reserved", spoilt([](auto& b) { b[12] = 1; })},
      {"oversize text", spoilt([](auto& b) { b[8] = b[9] = b[10] = b[11] = 0xFF; })},
      {"oversize payload", spoilt([](auto& b) { b[23] = 0x7F; })},
      {"payload not matching the picture", spoilt([](auto& b) { b[16] += 1; })},
      {"impossible picture", spoilt([](auto& b) { b[24 + 3] = 0x80; })},  // negative width
      {"sound payload not channels x samples", AudioBytes(2, 10, 2 * 10 * 4 + 4)},
      {"too many channels", AudioBytes(ndilb::kMaxAudioChannels + 1, 10, (ndilb::kMaxAudioChannels + 1) * 10 * 4)},
  };
  for (const auto& [what, bytes] : cases) {
    SCOPED_TRACE(what);
    Decoder d = ReceiverDecoder();
    EXPECT_FALSE(d.Feed(bytes.data(), bytes.size()));
    EXPECT_TRUE(d.failed());
    EXPECT_FALSE(d.Pop().has_value());
    EXPECT_TRUE(d.WritableSpan().empty());
    const auto good = MetadataBytes("<x/>");
    EXPECT_FALSE(d.Feed(good.data(), good.size())) << "a failed decoder must stay failed";
  }
}

TEST(WireDecoder, EachEndAcceptsOnlyItsOwnMessages) {
  Decoder sender_side(ndilb::SenderSideLimits(), nullptr);
  const auto video = VideoBytes(8, 4, 0);
  EXPECT_FALSE(sender_side.Feed(video.data(), video.size())) << "receivers send no video";

  Decoder receiver_side = ReceiverDecoder();
  ndilb::EncodedHead hello = ndilb::EncodeHello(100, true, false);
  EXPECT_FALSE(receiver_side.Feed(hello.bytes, hello.size)) << "senders send no hello";

  Decoder ok(ndilb::SenderSideLimits(), nullptr);
  ASSERT_TRUE(ok.Feed(hello.bytes, hello.size));
  ndilb::EncodedHead tally = ndilb::EncodeTally(false, true);
  ASSERT_TRUE(ok.Feed(tally.bytes, tally.size));
  auto h = ok.Pop();
  ASSERT_TRUE(h.has_value());
  EXPECT_EQ(h->bandwidth, 100);
  EXPECT_TRUE(h->on_program);
  auto t = ok.Pop();
  ASSERT_TRUE(t.has_value());
  EXPECT_FALSE(t->on_program);
  EXPECT_TRUE(t->on_preview);
}

TEST(RegistryEntry, MalformedEntriesAreRefused) {
  ndilb::RegistryEntry e;
  EXPECT_TRUE(ndilb::ParseRegistryEntry("ndi-loopback 1\nname=H (a)\nurl=127.0.0.1:5\npid=7\n", &e));
  EXPECT_EQ(e.name, "H (a)");
  EXPECT_EQ(e.pid, 7);
  for (const char* bad : {"", "garbage", "ndi-loopback 2\nname=a\nurl=b\npid=1\n", "ndi-loopback 1\nname=a\nurl=b\n",
                          "ndi-loopback 1\nname=a\nurl=b\npid=x1\n", "ndi-loopback 1\nname=a\nurl=b\npid=1",
                          "ndi-loopback 1\nname=\nurl=b\npid=1\n", "ndi-loopback 1\nname=a\nurl=b\npid=99999999999\n"}) {
    EXPECT_FALSE(ndilb::ParseRegistryEntry(bad, &e)) << bad;
  }
  // A sender's full name: the host in capitals, then its own name.
  const std::string full = ndilb::FullSourceName("Cam 1");
  EXPECT_THAT(full, ::testing::MatchesRegex("[^a-z]+ \\(Cam 1\\)"));
}

TEST(ScalePicture, UyvyKeepsEveryOtherPixelWithItsChroma) {
  // 8x2 UYVY: pixel x has Y = 10 + x; macropixel m has U = 100 + m, V = 200 + m.
  std::vector<std::uint8_t> in(16 * 2);
  for (int y = 0; y < 2; ++y) {
    for (int m = 0; m < 4; ++m) {
      std::uint8_t* p = in.data() + y * 16 + 4 * m;
      p[0] = static_cast<std::uint8_t>(100 + m);
      p[1] = static_cast<std::uint8_t>(10 + 2 * m);
      p[2] = static_cast<std::uint8_t>(200 + m);
      p[3] = static_cast<std::uint8_t>(11 + 2 * m);
    }
  }
  ndilb::ScaledPicture half;
  ASSERT_TRUE(ndilb::ScalePicture(kNdiFourCCUYVY, 8, 2, 16, in.data(), 4, 1, &half));
  EXPECT_EQ(half.xres, 4);
  EXPECT_EQ(half.yres, 1);
  EXPECT_EQ(half.bytes, (std::vector<std::uint8_t>{100, 10, 200, 12, 102, 14, 202, 16}));
  EXPECT_FALSE(ndilb::ScalePicture(kNdiFourCCUYVY, 2, 1, 4, in.data(), 0, 1, &half)) << "nothing left";
}

// The sizes, FourCCs and strides the vendor runtime was seen to deliver.
TEST(Delivered, AsTheVendorRuntimeDeliversThem) {
  const int sizes[][4] = {{1920, 1080, 640, 360}, {3840, 2160, 640, 360}, {1440, 1080, 640, 480}, {720, 576, 640, 512},
                          {1080, 1920, 360, 640}, {1000, 1000, 640, 640}, {2048, 1080, 640, 336}, {1366, 768, 640, 358},
                          {1922, 1082, 640, 360}, {640, 360, 640, 360},   {330, 180, 330, 180},   {64, 16, 64, 16}};
  for (const auto& s : sizes) {
    int w = 0, h = 0;
    ndilb::ProxySize(s[0], s[1], &w, &h);
    EXPECT_EQ(w, s[2]) << s[0] << "x" << s[1];
    EXPECT_EQ(h, s[3]) << s[0] << "x" << s[1];
  }
  // Colour formats BGRX_BGRA, UYVY_BGRA, RGBX_RGBA, UYVY_RGBA, fastest.
  const std::uint32_t plain[] = {kNdiFourCCBGRX, kNdiFourCCUYVY, kNdiFourCCRGBX, kNdiFourCCUYVY, kNdiFourCCUYVY};
  const std::uint32_t alpha[] = {kNdiFourCCBGRA, kNdiFourCCBGRA, kNdiFourCCRGBA, kNdiFourCCRGBA, kNdiFourCCUYVA};
  const std::int32_t formats[] = {kNdiColorBgrxBgra, kNdiColorUyvyBgra, kNdiColorRgbxRgba, kNdiColorUyvyRgba,
                                  kNdiColorFastest};
  for (int i = 0; i < 5; ++i) {
    EXPECT_EQ(ndilb::DeliveredFourCC(formats[i], false), plain[i]) << formats[i];
    EXPECT_EQ(ndilb::DeliveredFourCC(formats[i], true), alpha[i]) << formats[i];
  }
  std::vector<std::uint8_t> bgra(8 * 4, 255);
  EXPECT_FALSE(ndilb::HasAlpha(kNdiFourCCBGRA, 4, 2, 16, bgra.data())) << "opaque";
  bgra[31] = 254;
  EXPECT_TRUE(ndilb::HasAlpha(kNdiFourCCBGRA, 4, 2, 16, bgra.data()));
  EXPECT_FALSE(ndilb::HasAlpha(kNdiFourCCBGRX, 4, 2, 16, bgra.data())) << "X is not alpha";
  EXPECT_TRUE(ndilb::HasAlpha(kNdiFourCCUYVA, 4, 2, 8, bgra.data()));
  EXPECT_EQ(ndilb::DeliveredStride(kNdiFourCCUYVY, 330), 672);
  EXPECT_EQ(ndilb::DeliveredStride(kNdiFourCCUYVY, 1366), 2752);
  EXPECT_EQ(ndilb::DeliveredStride(kNdiFourCCUYVY, 1920), 3840);
  EXPECT_EQ(ndilb::DeliveredStride(kNdiFourCCBGRX, 330), 1344);
}

// The 75% bars through the conversions, against what the vendor runtime made
// of the same bars (its YUV to RGB is not quite BT.709).
TEST(ConvertPicture, BarsBecomeWhatTheVendorRuntimeMakesOfThem) {
  struct Case {
    const char* from;
    std::uint32_t to;
    int expected[8][3];  // per bar: B, G, R for RGB targets; U, Y, V for UYVY
  };
  const Case cases[] = {
      {"uyvy", kNdiFourCCBGRX, {{190, 190, 190}, {7, 187, 190}, {187, 215, 0}, {5, 212, 0}, {185, 0, 191}, {2, 0, 191}, {182, 2, 0}, {0, 0, 0}}},
      {"nv12", kNdiFourCCBGRX, {{190, 190, 190}, {7, 187, 190}, {187, 215, 0}, {5, 212, 0}, {185, 0, 191}, {2, 0, 191}, {182, 2, 0}, {0, 0, 0}}},
      {"bgra", kNdiFourCCUYVY, {{127, 180, 128}, {43, 168, 135}, {146, 145, 44}, {63, 133, 51}, {192, 63, 204}, {108, 50, 211}, {211, 27, 120}, {128, 16, 128}}},
      {"rgbx", kNdiFourCCUYVY, {{127, 180, 128}, {43, 168, 135}, {146, 145, 44}, {63, 133, 51}, {192, 63, 204}, {108, 50, 211}, {211, 27, 120}, {128, 16, 128}}},
      {"i420", kNdiFourCCUYVY, {{128, 180, 128}, {44, 168, 136}, {147, 145, 44}, {63, 133, 52}, {193, 63, 204}, {109, 51, 212}, {212, 28, 120}, {128, 16, 128}}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.from);
    const std::uint32_t from = ndits::FourCCFromName(c.from);
    const auto planes = ndits::PictureLayout(from, 64, 4);
    std::vector<std::uint8_t> in(ndits::PictureSize(planes));
    ndits::Bars(from, 64, 4).Fill(1000, in.data());  // its marker covers rows 0 and 1
    const int stride = ndilb::DeliveredStride(c.to, 64);
    std::vector<std::uint8_t> out(ndilb::PictureBytes(c.to, 64, 4, stride));
    ASSERT_TRUE(ndilb::ConvertPicture(from, 64, 4, planes[0].stride, in.data(), c.to, stride, out.data()));
    const std::uint8_t* row = out.data() + 3 * static_cast<std::size_t>(stride);  // below the marker
    for (int bar = 0; bar < 8; ++bar) {
      const int x = bar * 8 + 4;
      const std::uint8_t* px = c.to == kNdiFourCCUYVY ? row + 2 * x : row + 4 * x;
      for (int k = 0; k < 3; ++k) EXPECT_NEAR(px[k], c.expected[bar][k], 3) << "bar " << bar << " channel " << k;
    }
  }
}

TEST(PictureBytes, RefusesImpossiblePictures) {
  EXPECT_EQ(ndilb::PictureBytes(kNdiFourCCUYVY, 1920, 1080, 3840), 1920u * 2 * 1080);
  EXPECT_EQ(ndilb::PictureBytes(kNdiFourCCNV12, 4, 4, 4), 24u);
  EXPECT_EQ(ndilb::PictureBytes(kNdiFourCCI420, 4, 4, 4), 24u);
  EXPECT_EQ(ndilb::PictureBytes(kNdiFourCCUYVA, 4, 2, 8), 16u + 8u);
  EXPECT_EQ(ndilb::PictureBytes(kNdiFourCCUYVY, 1920, 1080, 100), 0u) << "stride shorter than a row";
  EXPECT_EQ(ndilb::PictureBytes(0x12345678, 16, 16, 64), 0u);
  EXPECT_EQ(ndilb::PictureBytes(kNdiFourCCBGRA, -1, 16, 64), 0u);
  EXPECT_EQ(ndilb::PictureBytes(kNdiFourCCBGRA, 100000, 16, 400000), 0u);
}

TEST(InterleaveAudio, PlanarWithPaddedStrideBecomesSampleMajor) {
  const int channels = 3, samples = 5, stride_floats = 8;
  std::vector<float> planar(static_cast<std::size_t>(channels) * stride_floats, -1.0f);
  for (int c = 0; c < channels; ++c) {
    for (int s = 0; s < samples; ++s) planar[static_cast<std::size_t>(c * stride_floats + s)] = static_cast<float>(c * 100 + s);
  }
  ndi_audio_frame_v2 src{};
  src.sample_rate = 48000;
  src.no_channels = channels;
  src.no_samples = samples;
  src.data = planar.data();
  src.channel_stride_in_bytes = stride_floats * 4;
  std::vector<float> out(static_cast<std::size_t>(channels) * samples + 1, -7.0f);
  ndi_audio_frame_interleaved_32f dst{48000, channels, samples, 0, out.data()};
  NDIlib_util_audio_to_interleaved_32f_v2(&src, &dst);
  for (int s = 0; s < samples; ++s) {
    for (int c = 0; c < channels; ++c) EXPECT_EQ(out[static_cast<std::size_t>(s * channels + c)], c * 100 + s);
  }
  EXPECT_EQ(out.back(), -7.0f) << "wrote past no_samples x no_channels";
  NDIlib_util_audio_to_interleaved_32f_v2(nullptr, &dst);
  NDIlib_util_audio_to_interleaved_32f_v2(&src, nullptr);
}

}  // namespace
