// Signals that interrupt the pipeline's waits. A handler installed without SA_RESTART makes
// every interruptible wait return EINTR: the futex waits of the data pools and whatever else a
// worker or the caller blocks in. Regular files are never interrupted, so these runs check the
// waits; the wrappers' restart of interrupted reads and writes is swept in the other suites.
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "Common/StreamCompressor.h"
#include "Libraries/CompressData/CompressData.h"
#include "Plenzo.h"
#include "Support/TestSupport.h"

using namespace plzctest;

namespace {

// Sends SIGUSR1 to every thread of the process, over and over, while it lives.
class SignalStorm {
 public:
  SignalStorm() {
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    sigemptyset(&action.sa_mask);
    action.sa_flags = 0;  // no SA_RESTART: interrupted waits return EINTR
    sigaction(SIGUSR1, &action, &saved_);
    sender_ = std::thread([this] {
      pid_t self = static_cast<pid_t>(syscall(SYS_gettid));
      while (!stop_.load()) {
        DIR *tasks = opendir("/proc/self/task");
        if (!tasks) break;
        while (struct dirent *entry = readdir(tasks)) {
          pid_t tid = atoi(entry->d_name);
          if (tid > 0 && tid != self && syscall(SYS_tgkill, getpid(), tid, SIGUSR1) == 0) sent_++;
        }
        closedir(tasks);
        usleep(300);
      }
    });
  }
  ~SignalStorm() {
    stop_ = true;
    sender_.join();
    struct sigaction ignore = {};
    ignore.sa_handler = SIG_IGN;
    sigaction(SIGUSR1, &ignore, nullptr);  // anything still pending is dropped
    sigaction(SIGUSR1, &saved_, nullptr);
  }
  long sent() const { return sent_.load(); }

 private:
  struct sigaction saved_ = {};
  std::atomic<bool> stop_{false};
  std::atomic<long> sent_{0};
  std::thread sender_;
};

std::vector<uint8_t> logicalData(const std::string &path) {
  std::vector<uint8_t> data;
  FileHandle *fh = openFile(path.c_str(), path.c_str(), O_RDONLY);
  if (!fh) return data;
  decompressData(
      fh,
      [](int64_t offset, const void *bytes, int64_t count, void *context) {
        auto *out = static_cast<std::vector<uint8_t> *>(context);
        out->resize(static_cast<size_t>(offset + count));
        memcpy(out->data() + offset, bytes, static_cast<size_t>(count));
        return 0;
      },
      &data);
  fh->close(fh);
  return data;
}

TEST(InterruptedWaits, StreamsAndTheCompressionQueueRideOutASignalStorm) {
  ScratchDir dir;
  ASSERT_FALSE(dir.path().empty());
  constexpr int kFiles = 12;
  auto bytesOf = [](int i) { return compressibleBytes(static_cast<size_t>(150000 + i * 7000), static_cast<uint32_t>(i)); };
  for (int i = 0; i < kFiles; i++) writeFile(dir.file("existing-" + std::to_string(i)), bytesOf(i));

  SignalStorm storm;
  // New files, written in small pieces so that the caller and the compressor keep waiting for
  // each other on the pool.
  StreamCompressorQueue *queue = CreateStreamCompressorQueue();
  for (int i = 0; i < kFiles; i++) {
    std::string path = dir.file("new-" + std::to_string(i));
    std::vector<uint8_t> bytes = bytesOf(i);
    int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0644);
    ASSERT_GE(fd, 0);
    ::StreamCompressor *stream = CreateStreamCompressor(fd, path.c_str(), nullptr, queue, static_cast<int64_t>(bytes.size()));
    close(fd);
    ASSERT_NE(stream, nullptr);
    for (size_t at = 0; at < bytes.size(); at += 4096) {
      size_t count = std::min<size_t>(4096, bytes.size() - at);
      ASSERT_EQ(WriteToStreamCompressor(stream, bytes.data() + at, count), static_cast<int64_t>(count));
    }
    EXPECT_EQ(CloseStreamCompressor(stream), 0);
  }
  EXPECT_EQ(FinishStreamCompressorQueue(queue), 0);
  // Existing files, from two callers at once.
  StreamCompressorQueue *inPlace = CreateCompressionQueue(nullptr, nullptr, nullptr, nullptr, nullptr);
  std::thread other([&] {
    for (int i = 1; i < kFiles; i += 2)
      EXPECT_EQ(CompressFile(inPlace, dir.file("existing-" + std::to_string(i)).c_str(), nullptr), 1);
  });
  for (int i = 0; i < kFiles; i += 2)
    EXPECT_EQ(CompressFile(inPlace, dir.file("existing-" + std::to_string(i)).c_str(), nullptr), 1);
  other.join();
  FinishCompressionAndCleanUp(inPlace);
  EXPECT_GT(storm.sent(), 50) << "the storm hardly blew";

  for (int i = 0; i < kFiles; i++) {
    EXPECT_TRUE(logicalData(dir.file("new-" + std::to_string(i))) == bytesOf(i)) << i;
    EXPECT_TRUE(logicalData(dir.file("existing-" + std::to_string(i))) == bytesOf(i)) << i;
  }
}

}  // namespace
