// Line assembly of Log and LogText, and lines of any length.
#include <gtest/gtest.h>

#include <string>

#include "pm/runtime/context.h"
#include "pm/runtime/log.h"
#include "support/log_capture.h"

namespace {

using pm::Log;
using pm::LogText;
using pm::LogType;

TEST(Log, JoinsTagAndMessageWithExactlyOneNewline) {
  pmtest::LogCapture capture;
  Log(LogType::Normal, "#ndisource: ", "%s", "x");
  Log(LogType::Normal, "#ndisource: ", "already %d\n", 1);
  Log(LogType::Normal, nullptr, "%s", "");
  EXPECT_EQ(capture.Lines(), (std::vector<std::string>{"#ndisource: x\n", "#ndisource: already 1\n", "\n"}));
}

TEST(Log, PassesTheLevelToTheSink) {
  pm::Context* context = pm::GetContext();
  auto previous = context->logSink;
  int seen = -1;
  context->logSink = [&](LogType level, const char*) { seen = static_cast<int>(level); };
  Log(LogType::Normal, "", "a");
  LogText("", "b");
  context->logSink = previous;
  EXPECT_EQ(seen, 100);
}

TEST(Log, BadFormatWritesNothing) {
  pmtest::LogCapture capture;
  Log(LogType::Normal, "", nullptr);
  EXPECT_TRUE(capture.Lines().empty());
}

TEST(LogText, CompleteLineWithEmptyTagIsHandedThroughWithoutCopy) {
  pm::Context* context = pm::GetContext();
  auto previous = context->logSink;
  const char* seen = nullptr;
  context->logSink = [&](LogType, const char* line) { seen = line; };
  const char* text = "abc\n";
  LogText("", text);
  context->logSink = previous;
  EXPECT_EQ(seen, text);
}

TEST(LogText, AddsTagAndNewlineAndTreatsNullAsEmptyLine) {
  pmtest::LogCapture capture;
  LogText("#ndisource: ", "waiting for source to be found");
  LogText("#ndisource: ", "failed to create NDI receiver\n");
  LogText("", nullptr);
  LogText(nullptr, "plain");
  EXPECT_EQ(capture.Lines(),
            (std::vector<std::string>{"#ndisource: waiting for source to be found\n",
                                      "#ndisource: failed to create NDI receiver\n", "\n", "plain\n"}));
}

TEST(LogLongLines, AreDeliveredWholeByBothEntryPoints) {
  pmtest::LogCapture capture;
  for (std::size_t size : {1021u, 1022u, 1023u, 2000u, 100000u}) {
    const std::string message(size, 'm');
    Log(LogType::Normal, "tag: ", "%s", message.c_str());
    LogText("tag: ", message.c_str());
  }
  const auto lines = capture.Lines();
  ASSERT_EQ(lines.size(), 10u);
  std::size_t i = 0;
  for (std::size_t size : {1021u, 1022u, 1023u, 2000u, 100000u}) {
    const std::string expected = "tag: " + std::string(size, 'm') + "\n";
    EXPECT_EQ(lines[i++], expected) << size;
    EXPECT_EQ(lines[i++], expected) << size;
  }
}

TEST(LogLongLines, ShortLineAfterLongOneIsNotPolluted) {
  pmtest::LogCapture capture;
  Log(LogType::Normal, "", "%s", std::string(5000, 'z').c_str());
  Log(LogType::Normal, "", "short");
  EXPECT_EQ(capture.Lines().back(), "short\n");
}

TEST(LogDefaultSink, ServesAnEmptySlotWithoutWritingIt) {
  pm::Context* context = pm::GetContext();
  auto previous = context->logSink;
  context->logSink = nullptr;
  EXPECT_TRUE(static_cast<bool>(pm::CurrentLogSink()));
  // Writing the slot here would race with other threads reading it.
  EXPECT_FALSE(static_cast<bool>(context->logSink));
  context->logSink = previous;
}

}  // namespace
