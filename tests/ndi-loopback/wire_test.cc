// The loopback runtime's pieces that need no socket: the wire decoder, the
// registry entry format, and what becomes of a picture (the FourCC and the
// proxy size delivered, conversions, halving).
#include <gtest/gtest.h>

#include <tuple>
#include <vector>

#include "ndi-loopback/picture.h"
#include "ndi-testsrc/pattern.h"
#include "ndi-loopback/registry.h"
#include "ndi-loopback/wire.h"
#include "ndi/ndi_abi.h"

namespace {

using ndilb::Decoder;
using Bytes = std::vector<std::uint8_t>;

// A message on the wire: its head, its text, then `payload` bytes of `fill`.
Bytes Message(const ndilb::EncodedHead& head, const std::string& text = "", std::size_t payload = 0,
              std::uint8_t fill = 0) {
  Bytes bytes(head.bytes, head.bytes + head.size);
  bytes.insert(bytes.end(), text.begin(), text.end());
  bytes.insert(bytes.end(), payload, fill);
  return bytes;
}

// An 8x4 UYVY picture of `fill` bytes.
Bytes Video(std::uint8_t fill, const std::string& text = "") {
  const ndilb::VideoInfo info{.xres = 8, .yres = 4, .fourcc = kNdiFourCCUYVY, .frame_rate_N = 30, .frame_rate_D = 1,
                              .line_stride = 16, .timestamp = 1234567};
  return Message(ndilb::EncodeVideo(info, static_cast<std::uint32_t>(text.size()), 64), text, 64, fill);
}

Bytes Metadata(const std::string& text) {
  return Message(ndilb::EncodeMetadata(ndilb::MessageType::Metadata, 42, static_cast<std::uint32_t>(text.size())), text);
}

Decoder ReceiverDecoder() { return Decoder(ndilb::ReceiverSideLimits(), std::make_shared<ndilb::BufferPool>(2)); }

TEST(WireDecoder, WholeMessagesComeOutWhateverTheFragmentation) {
  const Bytes video = Video(0xAB, "<frame/>"), metadata = Metadata("<hello/>");
  Bytes stream = video;
  stream.insert(stream.end(), metadata.begin(), metadata.end());
  for (std::size_t chunk : {stream.size(), std::size_t{1}, std::size_t{7}, std::size_t{25}}) {
    SCOPED_TRACE(chunk);
    Decoder d = ReceiverDecoder();
    std::vector<std::size_t> ends;  // how far the stream had come when each message came out
    for (std::size_t at = 0; at < stream.size(); at += chunk) {
      const std::size_t n = std::min(chunk, stream.size() - at);
      ASSERT_TRUE(d.Feed(stream.data() + at, n)) << d.error();
      while (auto m = d.Pop()) {
        ends.push_back(at + n);
        const Bytes payload(m->payload.data(), m->payload.data() + m->payload.size());
        EXPECT_EQ(std::make_tuple(m->video.xres, m->video.timestamp, m->text, m->timecode, payload),
                  ends.size() == 1 ? std::make_tuple(8, 1234567, "<frame/>", 0, Bytes(64, 0xAB))
                                   : std::make_tuple(0, 0, "<hello/>", 42, Bytes()));
      }
    }
    // Never before its last byte: the first comes with the piece that holds it.
    EXPECT_EQ(ends, (std::vector<std::size_t>{std::min((video.size() + chunk - 1) / chunk * chunk, stream.size()),
                                              stream.size()}));
  }
}

// Each end accepts only its own messages: receivers send no video, senders
// no hello.
TEST(WireDecoder, RejectsBadHeadersAndTheOtherEndsMessagesBeforeAllocatingAndStaysFailed) {
  auto spoilt = [](void (*spoil)(Bytes&)) {
    Bytes bytes = Video(1);
    spoil(bytes);
    return bytes;
  };
  auto audio = [](int channels, std::uint64_t payload) {
    return Message(ndilb::EncodeAudio({.sample_rate = 48000, .channels = channels, .samples = 10}, 0, payload));
  };
  const std::pair<const char*, Bytes> cases[] = {
      {"video to a sender", Video(0)},
      {"hello to a receiver", Message(ndilb::EncodeHello(100, true, false))},
      {"magic", spoilt([](auto& b) { b[0] ^= 0xFF; })},
      {"type", spoilt([](auto& b) { b[4] = 99; })},
      {"info size", spoilt([](auto& b) { b[6] = 47; })},
      {"reserved", spoilt([](auto& b) { b[12] = 1; })},
      {"oversize text", spoilt([](auto& b) { b[8] = b[9] = b[10] = b[11] = 0xFF; })},
      {"oversize payload", spoilt([](auto& b) { b[23] = 0x7F; })},
      {"payload not matching the picture", spoilt([](auto& b) { b[16] += 1; })},
      {"stride shorter than a row",
       Message(ndilb::EncodeVideo({.xres = 8, .yres = 4, .fourcc = kNdiFourCCUYVY, .line_stride = 8}, 0, 8 * 4))},
      {"impossible picture", spoilt([](auto& b) { b[24 + 3] = 0x80; })},  // negative width
      {"sound payload not channels x samples", audio(2, 2 * 10 * 4 + 4)},
      {"too many channels", audio(ndilb::kMaxAudioChannels + 1, (ndilb::kMaxAudioChannels + 1) * 10 * 4)},
  };
  for (const auto& [what, bytes] : cases) {
    SCOPED_TRACE(what);
    Decoder d = std::string(what) == "video to a sender" ? Decoder(ndilb::SenderSideLimits(), nullptr) : ReceiverDecoder();
    EXPECT_FALSE(d.Feed(bytes.data(), bytes.size()));
    EXPECT_FALSE(d.Pop().has_value());
    const Bytes good = Metadata("<x/>");
    EXPECT_FALSE(d.Feed(good.data(), good.size())) << "a failed decoder must stay failed";
  }
}

TEST(RegistryEntry, MalformedEntriesAreRefused) {
  // (Well-formed entries, also with since= and gone=: the listing's case in
  // loopback_test.)
  ndilb::RegistryEntry e;
  for (const char* bad : {"", "garbage", "ndi-loopback 2\nname=a\nurl=b\npid=1\n", "ndi-loopback 1\nname=a\nurl=b\n",
                          "ndi-loopback 1\nname=a\nurl=b\npid=x1\n", "ndi-loopback 1\nname=a\nurl=b\npid=1",
                          "ndi-loopback 1\nname=\nurl=b\npid=1\n", "ndi-loopback 1\nname=a\nurl=b\npid=99999999999\n"}) {
    EXPECT_FALSE(ndilb::ParseRegistryEntry(bad, &e)) << bad;
  }
}

// The proxy sizes and the FourCCs the vendor runtime was seen to deliver.
TEST(Delivered, AsTheVendorRuntimeDeliversThem) {
  const int sizes[][4] = {{1920, 1080, 640, 360}, {3840, 2160, 640, 360}, {1440, 1080, 640, 480}, {720, 576, 640, 512},
                          {1080, 1920, 360, 640}, {1000, 1000, 640, 640}, {2048, 1080, 640, 336}, {1366, 768, 640, 358},
                          {1922, 1082, 640, 360}, {640, 360, 640, 360},   {330, 180, 330, 180},   {64, 16, 64, 16}};
  for (const auto& s : sizes) {
    int w = 0, h = 0;
    ndilb::ProxySize(s[0], s[1], &w, &h);
    EXPECT_EQ(std::make_pair(w, h), std::make_pair(s[2], s[3])) << s[0] << "x" << s[1];
  }
  // Per colour format: pictures without alpha, pictures with alpha.
  const std::tuple<std::int32_t, std::uint32_t, std::uint32_t> formats[] = {
      {kNdiColorBgrxBgra, kNdiFourCCBGRX, kNdiFourCCBGRA}, {kNdiColorUyvyBgra, kNdiFourCCUYVY, kNdiFourCCBGRA},
      {kNdiColorRgbxRgba, kNdiFourCCRGBX, kNdiFourCCRGBA}, {kNdiColorUyvyRgba, kNdiFourCCUYVY, kNdiFourCCRGBA},
      {kNdiColorFastest, kNdiFourCCUYVY, kNdiFourCCUYVA}};
  for (const auto& [format, plain, alpha] : formats) {
    EXPECT_EQ(std::make_pair(ndilb::DeliveredFourCC(format, false), ndilb::DeliveredFourCC(format, true)),
              std::make_pair(plain, alpha)) << format;
  }
  // Alpha below 255 in one pixel (the other FourCCs' alpha: the pictures case
  // of loopback_test).
  std::vector<std::uint8_t> bgra(8 * 4, 255);
  EXPECT_FALSE(ndilb::HasAlpha(kNdiFourCCBGRA, 4, 2, 16, bgra.data())) << "opaque";
  bgra[31] = 254;
  EXPECT_TRUE(ndilb::HasAlpha(kNdiFourCCBGRA, 4, 2, 16, bgra.data()));
}

// The 75% bars through the conversions, against what the vendor runtime made
// of the same bars (its YUV to RGB is not quite BT.709); and halved (the
// lowest bandwidth's proxy), every other pixel with its own colour.
TEST(ConvertPicture, BarsBecomeWhatTheVendorRuntimeMakesOfThem) {
  // From, to, and per bar: B, G, R for RGB targets; U, Y, V for UYVY.
  const struct {
    const char* from;
    std::uint32_t to;
    int expected[8][3];
  } cases[] = {
      {"uyvy", kNdiFourCCBGRX, {{190, 190, 190}, {7, 187, 190}, {187, 215, 0}, {5, 212, 0}, {185, 0, 191}, {2, 0, 191}, {182, 2, 0}, {0, 0, 0}}},
      {"nv12", kNdiFourCCBGRX, {{190, 190, 190}, {7, 187, 190}, {187, 215, 0}, {5, 212, 0}, {185, 0, 191}, {2, 0, 191}, {182, 2, 0}, {0, 0, 0}}},
      {"bgra", kNdiFourCCUYVY, {{127, 180, 128}, {43, 168, 135}, {146, 145, 44}, {63, 133, 51}, {192, 63, 204}, {108, 50, 211}, {211, 27, 120}, {128, 16, 128}}},
      {"rgbx", kNdiFourCCUYVY, {{127, 180, 128}, {43, 168, 135}, {146, 145, 44}, {63, 133, 51}, {192, 63, 204}, {108, 50, 211}, {211, 27, 120}, {128, 16, 128}}},
      {"i420", kNdiFourCCUYVY, {{128, 180, 128}, {44, 168, 136}, {147, 145, 44}, {63, 133, 52}, {193, 63, 204}, {109, 51, 212}, {212, 28, 120}, {128, 16, 128}}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.from);
    const std::uint32_t from = ndits::FourCCFromName(c.from);
    const auto planes = ndits::PictureLayout(from, 64, 4);
    std::vector<std::uint8_t> in(ndits::PictureSize(planes));
    ndits::Bars(from, 64, 4).Fill(1000, in.data());  // its marker covers rows 0 and 1
    const int stride = ndilb::DeliveredStride(c.to, 64);
    std::vector<std::uint8_t> out(ndilb::PictureBytes(c.to, 64, 4, stride));
    ASSERT_TRUE(ndilb::ConvertPicture(from, 64, 4, planes[0].stride, in.data(), c.to, stride, out.data()));
    ndilb::ScaledPicture half;
    ASSERT_TRUE(ndilb::ScalePicture(c.to, 64, 4, stride, out.data(), 32, 2, &half));
    const int bytes = c.to == kNdiFourCCUYVY ? 2 : 4;  // per pixel
    for (int bar = 0; bar < 8; ++bar) {
      // Row 3 (below the marker), and what became of it in the proxy's row 1.
      const std::uint8_t* px = out.data() + 3 * stride + bytes * (bar * 8 + 4);
      const std::uint8_t* halved = half.bytes.data() + half.stride + bytes * (bar * 4 + 2);
      for (int k = 0; k < 3; ++k) {
        EXPECT_NEAR(px[k], c.expected[bar][k], 3) << "bar " << bar << " channel " << k;
        EXPECT_EQ(halved[k], px[k]) << "halved, bar " << bar << " channel " << k;
      }
    }
  }
}

}  // namespace
