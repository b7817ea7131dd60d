#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <fmt/format.h>
#include <memory>
#include <regex>
#include <string>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "platform/log/Log.h"

namespace tn::log {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::system_clock;

// 2026-11-22T20:53:00Z
constexpr seconds kSampleTime{1795380780};

Record sampleRecord(std::string_view text) {
  return Record{kSubsystem, "ops", Level::Info, text, system_clock::time_point(kSampleTime), 1};
}

// Everything written to a temporary file, read back after the writers are done.
class TemporaryFile {
 public:
  TemporaryFile() : file_(std::tmpfile()) {}
  ~TemporaryFile() { std::fclose(file_); }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  int fd() const { return ::fileno(file_); }

  std::string contents() const {
    std::string text;
    char buffer[4096];
    for (off_t offset = 0;;) {
      ssize_t got = ::pread(fd(), buffer, sizeof buffer, offset);
      if (got <= 0) break;
      text.append(buffer, static_cast<std::size_t>(got));
      offset += got;
    }
    return text;
  }

 private:
  std::FILE* file_;
};

std::vector<std::string> splitLines(const std::string& text) {
  std::vector<std::string> lines;
  std::size_t start = 0;
  for (std::size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1) {
    lines.push_back(text.substr(start, end - start));
  }
  EXPECT_EQ(start, text.size()) << "text ends in the middle of a line";
  return lines;
}

// --- stderr sink ---

TEST(StderrSinkTest, TimestampsAreUtcWithTruncatedMilliseconds) {
  EXPECT_EQ(formatTimestamp(system_clock::time_point(kSampleTime + milliseconds(123))),
            "2026-11-22T20:53:00.123Z");
  auto almostNextSecond = kSampleTime + std::chrono::microseconds(999999);
  EXPECT_EQ(formatTimestamp(system_clock::time_point(almostNextSecond)),
            "2026-11-22T20:53:00.999Z");
  EXPECT_EQ(formatTimestamp(system_clock::time_point()), "1970-01-01T00:00:00.000Z");
}

TEST(StderrSinkTest, WritesOneDocumentedLinePerRecord) {
  TemporaryFile file;
  StderrSink sink(file.fd(), "tenond");
  Record record = sampleRecord("client 12 sent\n2 requests");
  record.timestamp += milliseconds(45);
  sink.write(record);
  record.category = "default";
  record.level = Level::Error;
  record.text = "second";
  sink.write(record);

  EXPECT_EQ(file.contents(),
            fmt::format(
                "2026-11-22T20:53:00.045Z tenond[{0}] ops.info: client 12 sent\\n2 requests\n"
                "2026-11-22T20:53:00.045Z tenond[{0}] default.error: second\n",
                ::getpid()));
}

TEST(StderrSinkTest, ConcurrentWritersNeverInterleaveLines) {
  constexpr int kWriters = 8;
  constexpr int kLinesEach = 200;
  TemporaryFile file;
  StderrSink sink(file.fd(), "tenond");
  std::vector<std::thread> writers;
  for (int writer = 0; writer < kWriters; ++writer) {
    writers.emplace_back([&sink, writer] {
      for (int line = 0; line < kLinesEach; ++line) {
        std::string text = fmt::format("writer {} line {} {}", writer, line, std::string(60, 'x'));
        Record record{kSubsystem, "traffic", Level::Debug, text, system_clock::now(), ::gettid()};
        sink.write(record);
      }
    });
  }
  for (std::thread& writer : writers) writer.join();

  const std::regex shape(R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{3}Z tenond\[\d+\] )"
                         R"(traffic\.debug: writer (\d) line \d+ x{60})");
  std::vector<int> perWriter(kWriters, 0);
  for (const std::string& line : splitLines(file.contents())) {
    std::smatch match;
    ASSERT_TRUE(std::regex_match(line, match, shape)) << line;
    ++perWriter[static_cast<std::size_t>(std::stoi(match[1].str()))];
  }
  EXPECT_EQ(perWriter, std::vector<int>(kWriters, kLinesEach));
}

// --- journal detection ---

TEST(JournalDetectionTest, MatchesOnlyTheDeviceAndInodeOfTheDescriptor) {
  TemporaryFile file;
  struct stat status {};
  ASSERT_EQ(::fstat(file.fd(), &status), 0);
  auto device = static_cast<unsigned long long>(status.st_dev);
  auto inode = static_cast<unsigned long long>(status.st_ino);

  EXPECT_TRUE(journalStreamMatches(fmt::format("{}:{}", device, inode).c_str(), file.fd()));
  EXPECT_FALSE(journalStreamMatches(fmt::format("{}:{}", device, inode + 1).c_str(), file.fd()));
  EXPECT_FALSE(journalStreamMatches(fmt::format("{}:{}", device + 1, inode).c_str(), file.fd()));
  for (const char* malformed : {"", ":", "1:", ":1", "12", "1:2:3", "a:b", " 1:2", "-1:2"}) {
    EXPECT_FALSE(journalStreamMatches(malformed, file.fd())) << malformed;
  }
  EXPECT_FALSE(journalStreamMatches(nullptr, file.fd()));
  EXPECT_FALSE(journalStreamMatches(fmt::format("{}:{}", device, inode).c_str(), -1));
}

TEST(JournalDetectionTest, DefaultSinkIsTheJournalOnlyWhenStderrIsTheJournalStream) {
  struct stat status {};
  ASSERT_EQ(::fstat(STDERR_FILENO, &status), 0);
  const char* saved = std::getenv("JOURNAL_STREAM");
  std::string savedValue = saved ? saved : "";

  ::setenv("JOURNAL_STREAM", fmt::format("{}:{}", status.st_dev, status.st_ino).c_str(), 1);
  auto journal = makeDefaultSink();
  EXPECT_NE(dynamic_cast<JournalSink*>(journal.get()), nullptr);

  ::setenv("JOURNAL_STREAM", fmt::format("{}:{}", status.st_dev, status.st_ino + 1).c_str(), 1);
  EXPECT_NE(dynamic_cast<StderrSink*>(makeDefaultSink().get()), nullptr);
  ::unsetenv("JOURNAL_STREAM");
  EXPECT_NE(dynamic_cast<StderrSink*>(makeDefaultSink().get()), nullptr);

  if (saved) ::setenv("JOURNAL_STREAM", savedValue.c_str(), 1);
}

// --- the current sink ---

TEST(OutputTest, SetSinkSwapsAndReturnsThePreviousSink) {
  std::shared_ptr<Sink> original = currentSink();
  ASSERT_TRUE(original);
  auto first = std::make_shared<CaptureSink>();
  EXPECT_EQ(setSink(first), original);
  {
    ScopedCaptureSink inner;
    TN_LOG_ERROR(ops(), "to the inner capture");
    EXPECT_EQ(inner->records().size(), 1u);
  }
  EXPECT_EQ(currentSink(), first);
  TN_LOG_ERROR(ops(), "to the first capture");
  EXPECT_EQ(first->lines(), std::vector<std::string>{"ops error to the first capture"});
  EXPECT_EQ(setSink(original), first);

  // A null sink stands for a fresh default sink.
  std::shared_ptr<Sink> previous = setSink(nullptr);
  EXPECT_EQ(previous, original);
  EXPECT_TRUE(currentSink());
  EXPECT_NE(currentSink(), original);
  setSink(original);
}

TEST(OutputTest, SinkCanBeSwappedWhileOtherThreadsLog) {
  auto first = std::make_shared<CaptureSink>();
  auto second = std::make_shared<CaptureSink>();
  std::shared_ptr<Sink> original = setSink(first);
  constexpr int kLoggers = 4;
  constexpr int kMessagesEach = 500;
  std::vector<std::thread> loggers;
  for (int i = 0; i < kLoggers; ++i) {
    loggers.emplace_back([] {
      for (int n = 0; n < kMessagesEach; ++n) TN_LOG_ERROR(rg(), "message {}", n);
    });
  }
  for (int swap = 0; swap < 100; ++swap) setSink(swap % 2 == 0 ? second : first);
  for (std::thread& logger : loggers) logger.join();
  setSink(original);
  EXPECT_EQ(first->records().size() + second->records().size(),
            static_cast<std::size_t>(kLoggers * kMessagesEach));
}

}  // namespace
}  // namespace tn::log
