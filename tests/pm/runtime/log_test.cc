// Line assembly of Log and LogText, what the sink is handed, and lines of any
// length.
#include <gtest/gtest.h>

#include <string>

#include "pm/runtime/context.h"
#include "pm/runtime/log.h"
#include "support/log_capture.h"

namespace {

using Lines = std::vector<std::string>;

// Exactly one newline ends each line; a null tag or text counts as empty; a
// null format writes nothing.
TEST(Log, JoinsTagAndTextWithExactlyOneNewline) {
  pmtest::LogCapture capture;
  pm::Log(pm::LogType::Normal, "t: ", "%s", "x");
  pm::Log(pm::LogType::Normal, "t: ", "already %d\n", 1);
  pm::Log(pm::LogType::Normal, nullptr, "%s", "");
  pm::Log(pm::LogType::Normal, "", nullptr);
  pm::LogText("t: ", "text\n");
  pm::LogText("", nullptr);
  pm::LogText(nullptr, "plain");
  EXPECT_EQ(capture.Lines(), (Lines{"t: x\n", "t: already 1\n", "\n", "t: text\n", "\n", "plain\n"}));
}

TEST(Log, LongLinesAreDeliveredWholeByBothEntryPointsAndLeaveNothingBehind) {
  pmtest::LogCapture capture;
  Lines expected;
  for (std::size_t size : {1021u, 1022u, 1023u, 2000u, 100000u}) {
    const std::string message(size, 'm');
    pm::Log(pm::LogType::Normal, "tag: ", "%s", message.c_str());
    pm::LogText("tag: ", message.c_str());
    expected.insert(expected.end(), 2, "tag: " + message + "\n");
  }
  pm::Log(pm::LogType::Normal, "", "short");
  expected.push_back("short\n");
  EXPECT_EQ(capture.Lines(), expected);
}

TEST(LogSink, DefaultServesAnEmptySlotWithoutWritingIt) {
  pm::Context* context = pm::GetContext();
  auto previous = context->logSink;
  context->logSink = nullptr;
  EXPECT_TRUE(static_cast<bool>(pm::CurrentLogSink()));
  // Writing the slot here would race with other threads reading it.
  EXPECT_FALSE(static_cast<bool>(context->logSink));
  context->logSink = previous;
}

}  // namespace
