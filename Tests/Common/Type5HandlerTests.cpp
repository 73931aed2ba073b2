// The type-5 service loop against a device played by the test: a sequenced-packet socket at the
// device path, 48-byte records each way, the loop on its own thread and the system log captured.
#include "Plenzo.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdarg>
#include <cstdint>
#include <cstring>
#include <deque>
#include <functional>
#include <future>
#include <initializer_list>
#include <latch>
#include <limits>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Platform/Syscalls.h"
#include "Platform/SystemLog.h"
#include "Platform/Type5Device.h"

namespace {

using namespace std::chrono_literals;
using Record = std::array<uint8_t, 48>;

constexpr auto kAnswerTimeout = 10s;
// How long "nothing arrives" is watched for.
constexpr auto kQuiet = 200ms;

Record makeRequest(uint64_t header, int64_t type, uint64_t value1 = 0, uint64_t value2 = 0, uint64_t value3 = 0,
                   uint64_t value4 = 0) {
  Record record{};
  uint64_t fields[6] = {header, static_cast<uint64_t>(type), value1, value2, value3, value4};
  for (size_t i = 0; i < 6; ++i) memcpy(&record[8 * i], &fields[i], 8);
  return record;
}

uint64_t field(const Record &record, size_t offset) {
  uint64_t value;
  memcpy(&value, &record[offset], 8);
  return value;
}

// ---- System log capture ---------------------------------------------------------------------

using LogLine = std::pair<int, std::string>;

std::mutex gLogMutex;
std::vector<LogLine> gLog;

void captureLog(int priority, const char *format, va_list arguments) {
  char text[512];
  vsnprintf(text, sizeof text, format, arguments);
  std::lock_guard lock(gLogMutex);
  gLog.emplace_back(priority, text);
}

std::vector<LogLine> loggedLines() {
  std::lock_guard lock(gLogMutex);
  return gLog;
}

void clearLog() {
  std::lock_guard lock(gLogMutex);
  gLog.clear();
}

std::vector<LogLine> errors(std::initializer_list<std::string> texts) {
  std::vector<LogLine> lines;
  for (const std::string &text : texts) lines.emplace_back(LOG_ERR, text);
  return lines;
}

// ---- The caller's callbacks -----------------------------------------------------------------

// What the current test does with each request; called on the loop's thread.
struct Handlers {
  std::function<void(uint64_t, uint64_t, uint64_t, uint64_t, Type5Completion *)> type1;
  std::function<void(uint64_t, uint64_t)> type2;
};
Handlers gHandlers;

int onType1(uint64_t value1, uint64_t value2, uint64_t value3, uint64_t value4, Type5Completion *completion) {
  if (gHandlers.type1) gHandlers.type1(value1, value2, value3, value4, completion);
  return 0;
}

int onType2(uint64_t value1, uint64_t value2) {
  if (gHandlers.type2) gHandlers.type2(value1, value2);
  return 0;
}

constexpr Type5Callbacks kCallbacks = {onType1, onType2};

// Keeps a copy of the completion of each type-1 request (the last one wins) for the test to
// answer later.
class KeptCompletion {
 public:
  KeptCompletion() {
    gHandlers.type1 = [this](uint64_t, uint64_t, uint64_t, uint64_t, Type5Completion *c) {
      std::lock_guard lock(mutex_);
      kept_ = Type5CompletionCopy(c);
    };
  }
  Type5Completion *take() {
    std::lock_guard lock(mutex_);
    return std::exchange(kept_, nullptr);
  }

 private:
  std::mutex mutex_;
  Type5Completion *kept_ = nullptr;
};

// ---- The device's side ----------------------------------------------------------------------

// A sequenced-packet socket listening at a path. serve() runs type5_handler_function on its own
// thread; a reader thread accepts the loop's connection and collects every packet the library
// writes, and notes when the library closes its end.
class FakeDevice {
 public:
  explicit FakeDevice(std::string path) : path_(std::move(path)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path_.size() >= sizeof address.sun_path) {
      error_ = "path too long";
      return;
    }
    memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
    listener_ = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
    if (listener_ < 0 || bind(listener_, reinterpret_cast<sockaddr *>(&address), sizeof address) != 0 ||
        listen(listener_, 1) != 0) {
      error_ = std::string("cannot listen at ") + path_ + ": " + strerror(errno);
      return;
    }
    bound_ = true;
  }

  ~FakeDevice() {
    stop_ = true;
    {
      std::lock_guard lock(mutex_);
      // Our end hangs up: a loop still waiting for a request reads end of file and returns.
      if (peer_ >= 0) shutdown(peer_, SHUT_RDWR);
    }
    if (reader_.joinable()) reader_.join();
    // Resets a connection never accepted, so that a loop waiting on it returns too.
    if (listener_ >= 0) close(listener_);
    if (loop_.valid()) loop_.wait();
    if (peer_ >= 0) close(peer_);
    if (bound_) unlink(path_.c_str());
  }

  FakeDevice(const FakeDevice &) = delete;
  FakeDevice &operator=(const FakeDevice &) = delete;

  bool listening() const { return bound_; }
  const std::string &error() const { return error_; }

  void serve(const Type5Callbacks *callbacks = &kCallbacks) {
    loop_ = std::async(std::launch::async, [callbacks] { return type5_handler_function(callbacks); });
    reader_ = std::thread([this] { collectAnswers(); });
  }

  // Sends one request packet to the loop.
  void send(const Record &record) { sendBytes(record.data(), record.size()); }
  void sendBytes(const void *bytes, size_t count) {
    int peer = connectedPeer();
    ASSERT_GE(peer, 0) << "the handler never connected";
    ASSERT_EQ(::send(peer, bytes, count, MSG_NOSIGNAL), static_cast<ssize_t>(count)) << strerror(errno);
  }
  // Our end stops sending: the loop's next read sees end of file.
  void hangUp() {
    int peer = connectedPeer();
    ASSERT_GE(peer, 0) << "the handler never connected";
    shutdown(peer, SHUT_WR);
  }
  // Our end goes away altogether: the loop reads end of file, and a write to the device fails.
  void goAway() {
    int peer = connectedPeer();
    ASSERT_GE(peer, 0) << "the handler never connected";
    shutdown(peer, SHUT_RDWR);
  }

  // The next packet the library wrote, or nothing after the timeout.
  std::optional<std::vector<uint8_t>> nextPacket(std::chrono::milliseconds timeout) {
    std::unique_lock lock(mutex_);
    if (!changed_.wait_for(lock, timeout, [this] { return !packets_.empty(); })) return std::nullopt;
    std::vector<uint8_t> packet = std::move(packets_.front());
    packets_.pop_front();
    return packet;
  }
  // The next answer, which must be one whole record.
  Record nextRecord() {
    std::optional<std::vector<uint8_t>> packet = nextPacket(kAnswerTimeout);
    Record record{};
    if (!packet) {
      ADD_FAILURE() << "no answer from the handler";
    } else if (packet->size() != record.size()) {
      ADD_FAILURE() << "an answer of " << packet->size() << " bytes";
    } else {
      std::copy(packet->begin(), packet->end(), record.begin());
    }
    return record;
  }
  // True when nothing is written for a while; consumes nothing.
  bool quiet() {
    std::unique_lock lock(mutex_);
    return !changed_.wait_for(lock, kQuiet, [this] { return !packets_.empty(); });
  }

  // The loop's result once it has returned; nothing if it is still running after the timeout.
  std::optional<int> loopResult(std::chrono::milliseconds timeout = kAnswerTimeout) {
    if (!result_ && loop_.valid() && loop_.wait_for(timeout) == std::future_status::ready) result_ = loop_.get();
    return result_;
  }
  // Whether the library closed its end of the device within the timeout.
  bool closedByLibrary(std::chrono::milliseconds timeout = kAnswerTimeout) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, timeout, [this] { return libraryClosed_; });
  }
  bool everConnected() {
    std::lock_guard lock(mutex_);
    return peer_ >= 0;
  }

 private:
  int connectedPeer() {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, kAnswerTimeout, [this] { return peer_ >= 0; });
    return peer_;
  }

  void collectAnswers() {
    int peer = -1;
    while (!stop_) {
      pollfd waiting = {listener_, POLLIN, 0};
      if (poll(&waiting, 1, 20) == 1) {
        peer = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
        break;
      }
    }
    if (peer < 0) return;
    {
      std::lock_guard lock(mutex_);
      peer_ = peer;
      if (stop_) shutdown(peer, SHUT_RDWR);  // accepted while the destructor was hanging up
    }
    changed_.notify_all();
    for (;;) {
      // Larger than a record, so that an answer of the wrong size shows as such.
      std::vector<uint8_t> packet(256);
      ssize_t got = recv(peer, packet.data(), packet.size(), 0);
      std::lock_guard lock(mutex_);
      if (got <= 0) {
        libraryClosed_ = got == 0 && !stop_;
        changed_.notify_all();
        return;
      }
      packet.resize(static_cast<size_t>(got));
      packets_.push_back(std::move(packet));
      changed_.notify_all();
    }
  }

  std::string path_;
  std::string error_;
  int listener_ = -1;
  bool bound_ = false;
  std::atomic<bool> stop_{false};
  std::future<int> loop_;
  std::optional<int> result_;
  std::thread reader_;

  std::mutex mutex_;
  std::condition_variable changed_;
  int peer_ = -1;
  std::deque<std::vector<uint8_t>> packets_;
  bool libraryClosed_ = false;
};

// Each test serves its own socket in a fresh directory, so that test processes running in
// parallel never meet; the log is captured and the callbacks reset.
class Type5HandlerTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/plzc-type5-XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr) << strerror(errno);
    dir_ = pattern;
    path_ = dir_ + "/plzc_type5";
    plzc::setType5DevicePath(path_.c_str());
    clearLog();
    previousSink_ = plzc::setSystemLogSink(captureLog);
    gHandlers = {};
  }

  void TearDown() override {
    device_.reset();
    sys::clearFaults();
    gHandlers = {};
    plzc::setSystemLogSink(previousSink_);
    plzc::setType5DevicePath(nullptr);
    unlink(path_.c_str());
    rmdir(dir_.c_str());
  }

  // A new device at the test's path (replacing the previous one); fails the test if it cannot listen.
  FakeDevice &freshDevice() {
    device_.reset();
    device_.emplace(path_);
    EXPECT_TRUE(device_->listening()) << device_->error();
    return *device_;
  }

  // Sends an unknown type and checks that the loop ends with 0 and closes the device.
  void endLoop(FakeDevice &device) {
    device.send(makeRequest(0xE17D, 3));
    EXPECT_EQ(device.loopResult(), std::optional<int>(0));
    EXPECT_TRUE(device.closedByLibrary());
  }

  std::string dir_;
  std::string path_;
  std::optional<FakeDevice> device_;
  plzc::SystemLogSink previousSink_ = nullptr;
};

// ---- Answers ----------------------------------------------------------------------------------

TEST_F(Type5HandlerTest, Type2IsAnsweredWithItsOwnBytesAfterItsHandlerReturns) {
  FakeDevice &device = freshDevice();
  std::mutex mutex;
  std::vector<std::pair<uint64_t, uint64_t>> calls;
  std::promise<void> mayReturn;
  std::future<void> gate = mayReturn.get_future();
  gHandlers.type2 = [&](uint64_t value1, uint64_t value2) {
    {
      std::lock_guard lock(mutex);
      calls.emplace_back(value1, value2);
    }
    gate.wait();
  };
  device.serve();
  Record request = makeRequest(0x0123456789ABCDEF, 2, 7, 9, 0xDEADBEEF, 0xFEEDFACE);
  device.send(request);
  EXPECT_TRUE(device.quiet()) << "answered before the handler returned";
  mayReturn.set_value();
  EXPECT_EQ(device.nextRecord(), request);
  {
    std::lock_guard lock(mutex);
    EXPECT_EQ(calls, (std::vector<std::pair<uint64_t, uint64_t>>{{7, 9}}));
  }
  endLoop(device);
  EXPECT_EQ(loggedLines(), errors({"unknown request type 3\n"}));
}

TEST_F(Type5HandlerTest, Type1AnsweredAtOnceCarriesTheCompletionValuesCrossed) {
  FakeDevice &device = freshDevice();
  std::mutex mutex;
  std::vector<std::array<uint64_t, 4>> calls;
  int invokeResult = -2;
  gHandlers.type1 = [&](uint64_t value1, uint64_t value2, uint64_t value3, uint64_t value4, Type5Completion *c) {
    int result = Type5CompletionInvoke(c, 10, 20, 30);
    std::lock_guard lock(mutex);
    calls.push_back({value1, value2, value3, value4});
    invokeResult = result;
  };
  device.serve();
  device.send(makeRequest(0xA5A5A5A5C3C3C3C3, 1, 1, 2, 3, 0x4444));
  Record answer = device.nextRecord();
  EXPECT_EQ(field(answer, 0), 0xA5A5A5A5C3C3C3C3u);
  EXPECT_EQ(field(answer, 8), 1u);
  EXPECT_EQ(field(answer, 16), 10u);
  EXPECT_EQ(field(answer, 24), 30u);
  EXPECT_EQ(field(answer, 32), 20u);
  EXPECT_EQ(field(answer, 40), 0x4444u);
  endLoop(device);
  std::lock_guard lock(mutex);
  EXPECT_EQ(calls, (std::vector<std::array<uint64_t, 4>>{{1, 2, 3, 0x4444}}));
  EXPECT_EQ(invokeResult, 0);
  EXPECT_EQ(loggedLines(), errors({"unknown request type 3\n"}));
}

TEST_F(Type5HandlerTest, KeptCompletionAnswersWithItsOwnRecordFromAnotherThread) {
  FakeDevice &device = freshDevice();
  std::mutex mutex;
  Type5Completion *kept = nullptr;
  gHandlers.type1 = [&](uint64_t value1, uint64_t value2, uint64_t value3, uint64_t value4, Type5Completion *c) {
    if (value4 == 0xA4) {
      std::lock_guard lock(mutex);
      kept = Type5CompletionCopy(c);
    } else {
      Type5CompletionInvoke(c, value1 + 100, value2 + 100, value3 + 100);
    }
  };
  device.serve();
  device.send(makeRequest(0xA0, 1, 1, 2, 3, 0xA4));
  // Three more requests served while the first waits: type 2, type 1 answered at once, type 2.
  Record b = makeRequest(0xB0, 2, 0xB1, 0xB2, 0xB3, 0xB4);
  Record d = makeRequest(0xD0, 2, 0xD1, 0xD2, 0xD3, 0xD4);
  device.send(b);
  device.send(makeRequest(0xC0, 1, 5, 6, 7, 0xC4));
  device.send(d);
  EXPECT_EQ(device.nextRecord(), b);
  EXPECT_EQ(device.nextRecord(), makeRequest(0xC0, 1, 105, 107, 106, 0xC4));
  EXPECT_EQ(device.nextRecord(), d);

  Type5Completion *completion;
  {
    std::lock_guard lock(mutex);
    completion = kept;
  }
  ASSERT_NE(completion, nullptr);
  int result = -2;
  std::thread([&] {
    result = Type5CompletionInvoke(completion, 11, 22, 33);
    Type5CompletionRelease(completion);
  }).join();
  EXPECT_EQ(result, 0);
  EXPECT_EQ(device.nextRecord(), makeRequest(0xA0, 1, 11, 33, 22, 0xA4));
  endLoop(device);
}

TEST_F(Type5HandlerTest, ConcurrentCompletionsEachWriteOneWholeRecord) {
  constexpr int kKept = 32;
  constexpr int kThreads = 4;
  constexpr int kType2 = 16;
  FakeDevice &device = freshDevice();
  std::mutex mutex;
  std::condition_variable keptMore;
  std::vector<Type5Completion *> kept;
  gHandlers.type1 = [&](uint64_t, uint64_t, uint64_t, uint64_t, Type5Completion *c) {
    std::lock_guard lock(mutex);
    kept.push_back(Type5CompletionCopy(c));
    keptMore.notify_all();
  };
  device.serve();
  for (uint64_t i = 0; i < kKept; ++i) device.send(makeRequest(0x5000 + i, 1, 0, 0, 0, i));
  std::vector<Type5Completion *> first, second;
  {
    std::unique_lock lock(mutex);
    ASSERT_TRUE(keptMore.wait_for(lock, kAnswerTimeout, [&] { return kept.size() == kKept; }));
    first = kept;
  }
  // Every record is answered twice, by two threads holding copies of their own.
  for (Type5Completion *completion : first) second.push_back(Type5CompletionCopy(completion));
  std::latch start(kThreads + 1);
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      start.arrive_and_wait();
      for (int i = 0; i < kKept; ++i) {
        uint64_t r3 = static_cast<uint64_t>(i) * 1000 + t;
        if (i % kThreads == t) {
          failures += Type5CompletionInvoke(first[i], i, t, r3) != 0;
          Type5CompletionRelease(first[i]);
        }
        if ((i + 1) % kThreads == t) {
          failures += Type5CompletionInvoke(second[i], i, t, r3) != 0;
          Type5CompletionRelease(second[i]);
        }
      }
    });
  }
  // The loop answers type-2 requests meanwhile, on the same descriptor.
  start.arrive_and_wait();
  for (uint64_t j = 0; j < kType2; ++j) device.send(makeRequest(0x9000 + j, 2, j, j + 1, j + 2, j + 3));
  for (std::thread &thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);

  std::map<std::pair<uint64_t, uint64_t>, int> type1Answers;
  int type2Answers = 0;
  for (int n = 0; n < 2 * kKept + kType2; ++n) {
    Record answer = device.nextRecord();
    uint64_t header = field(answer, 0);
    if (header >= 0x9000) {
      uint64_t j = header - 0x9000;
      EXPECT_EQ(answer, makeRequest(header, 2, j, j + 1, j + 2, j + 3));
      ++type2Answers;
      continue;
    }
    uint64_t i = header - 0x5000, t = field(answer, 32);
    EXPECT_LT(i, static_cast<uint64_t>(kKept));
    EXPECT_EQ(field(answer, 8), 1u);
    EXPECT_EQ(field(answer, 16), i);
    EXPECT_EQ(field(answer, 24), i * 1000 + t);
    EXPECT_EQ(field(answer, 40), i);
    EXPECT_TRUE(t == i % kThreads || t == (i + 1) % kThreads) << "record " << i << " answered by thread " << t;
    ++type1Answers[{i, t}];
  }
  EXPECT_EQ(type2Answers, kType2);
  EXPECT_EQ(type1Answers.size(), 2u * kKept);
  for (const auto &[key, count] : type1Answers) EXPECT_EQ(count, 1) << "record " << key.first;
  EXPECT_TRUE(device.quiet());
  endLoop(device);
}

// ---- Lifetimes --------------------------------------------------------------------------------

TEST_F(Type5HandlerTest, RecordAndDeviceLiveUntilTheLastCopyIsReleased) {
  FakeDevice &device = freshDevice();
  std::mutex mutex;
  Type5Completion *copyA = nullptr, *copyB = nullptr;
  gHandlers.type1 = [&](uint64_t, uint64_t, uint64_t, uint64_t, Type5Completion *c) {
    std::lock_guard lock(mutex);
    copyA = Type5CompletionCopy(c);
    copyB = Type5CompletionCopy(c);
  };
  device.serve();
  device.send(makeRequest(0xE0, 1, 1, 2, 3, 0xE4));
  device.send(makeRequest(0xF0, 3));
  EXPECT_EQ(device.loopResult(), std::optional<int>(0));
  {
    std::lock_guard lock(mutex);
    ASSERT_NE(copyA, nullptr);
  }
  // The loop has ended and given up its hold; the copies keep the record and the device.
  EXPECT_FALSE(device.closedByLibrary(kQuiet));
  Type5CompletionRelease(copyA);
  EXPECT_FALSE(device.closedByLibrary(kQuiet));
  EXPECT_EQ(Type5CompletionInvoke(copyB, 7, 8, 9), 0);
  EXPECT_EQ(device.nextRecord(), makeRequest(0xE0, 1, 7, 9, 8, 0xE4));
  Type5CompletionRelease(copyB);
  EXPECT_TRUE(device.closedByLibrary());
}

TEST_F(Type5HandlerTest, NeverInvokedCompletionGivesNoAnswerAndTheLoopGoesOn) {
  FakeDevice &device = freshDevice();
  std::atomic<int> type1Calls{0};
  gHandlers.type1 = [&](uint64_t, uint64_t, uint64_t, uint64_t, Type5Completion *) { ++type1Calls; };
  device.serve();
  device.send(makeRequest(0x10, 1, 1, 2, 3, 4));
  Record later = makeRequest(0x20, 2, 5, 6, 7, 8);
  device.send(later);
  EXPECT_EQ(device.nextRecord(), later);
  EXPECT_TRUE(device.quiet());
  EXPECT_EQ(type1Calls.load(), 1);
  // The device closes at the end: the loop gave up the unanswered record.
  endLoop(device);
}

// ---- End of the loop -------------------------------------------------------------------------

TEST_F(Type5HandlerTest, UnknownTypeEndsTheLoop) {
  gHandlers.type1 = [](uint64_t, uint64_t, uint64_t, uint64_t, Type5Completion *) { ADD_FAILURE() << "type 1 called"; };
  gHandlers.type2 = [](uint64_t, uint64_t) { ADD_FAILURE() << "type 2 called"; };
  for (int64_t type : {int64_t{3}, int64_t{0}, int64_t{-1}, std::numeric_limits<int64_t>::min(),
                       std::numeric_limits<int64_t>::max()}) {
    SCOPED_TRACE(type);
    clearLog();
    FakeDevice &device = freshDevice();
    device.serve();
    device.send(makeRequest(0x42, type, 1, 2, 3, 4));
    EXPECT_EQ(device.loopResult(), std::optional<int>(0));
    EXPECT_TRUE(device.closedByLibrary());
    EXPECT_FALSE(device.nextPacket(0ms).has_value());
    EXPECT_EQ(loggedLines(), errors({"unknown request type " + std::to_string(type) + "\n"}));
  }
}

TEST_F(Type5HandlerTest, EndOfFileOrFailedReadEndsTheLoopAsType0) {
  const std::vector<LogLine> endOfFile = errors({"read request: Success", "unknown request type 0\n"});
  {
    SCOPED_TRACE("socket hung up");
    FakeDevice &device = freshDevice();
    device.serve();
    device.hangUp();
    EXPECT_EQ(device.loopResult(), std::optional<int>(0));
    EXPECT_TRUE(device.closedByLibrary());
    EXPECT_EQ(loggedLines(), endOfFile);
  }
  {
    SCOPED_TRACE("read fails");
    clearLog();
    FakeDevice &device = freshDevice();
    sys::armFault(sys::Call::Read, 1, EIO);
    device.serve();
    EXPECT_EQ(device.loopResult(), std::optional<int>(0));
    EXPECT_TRUE(device.closedByLibrary());
    EXPECT_EQ(loggedLines(), errors({"read request: Input/output error", "unknown request type 0\n"}));
  }
  {
    SCOPED_TRACE("character device");
    clearLog();
    plzc::setType5DevicePath("/dev/null");
    EXPECT_EQ(type5_handler_function(&kCallbacks), 0);
    EXPECT_EQ(loggedLines(), endOfFile);
  }
}

TEST_F(Type5HandlerTest, ShortRequestIsServedAsFarAsItFilledAFreshRecord) {
  FakeDevice &device = freshDevice();
  std::mutex mutex;
  std::vector<std::pair<uint64_t, uint64_t>> calls;
  gHandlers.type2 = [&](uint64_t value1, uint64_t value2) {
    std::lock_guard lock(mutex);
    calls.emplace_back(value1, value2);
  };
  device.serve();
  Record full = makeRequest(0x77, 2, 1, 2, 3, 4);
  device.send(full);
  EXPECT_EQ(device.nextRecord(), full);
  // Header and type only: the rest reads as zeros, not as the previous request's values.
  device.sendBytes(makeRequest(0x88, 2).data(), 16);
  EXPECT_EQ(device.nextRecord(), makeRequest(0x88, 2));
  endLoop(device);
  std::lock_guard lock(mutex);
  EXPECT_EQ(calls, (std::vector<std::pair<uint64_t, uint64_t>>{{1, 2}, {0, 0}}));
  EXPECT_EQ(loggedLines(), errors({"read request: Success", "unknown request type 3\n"}));
}

// ---- Failures ---------------------------------------------------------------------------------

TEST_F(Type5HandlerTest, FailedAnswerIsLoggedAndTheLoopGoesOn) {
  FakeDevice &device = freshDevice();
  KeptCompletion kept;
  device.serve();
  sys::armFault(sys::Call::Write, 1, EIO);
  device.send(makeRequest(0xA, 2, 1, 2, 3, 4));
  Record next = makeRequest(0xB, 2, 5, 6, 7, 8);
  device.send(next);
  EXPECT_EQ(device.nextRecord(), next) << "the failed answer was written after all";

  device.send(makeRequest(0xC, 1, 1, 2, 3, 0xC4));
  device.send(next);
  EXPECT_EQ(device.nextRecord(), next);
  Type5Completion *completion = kept.take();
  ASSERT_NE(completion, nullptr);
  sys::armFault(sys::Call::Write, 1, ENOSPC);
  errno = 0;
  EXPECT_EQ(Type5CompletionInvoke(completion, 1, 2, 3), -1);
  EXPECT_EQ(errno, ENOSPC);
  EXPECT_EQ(Type5CompletionInvoke(completion, 4, 5, 6), 0);
  EXPECT_EQ(device.nextRecord(), makeRequest(0xC, 1, 4, 6, 5, 0xC4));
  Type5CompletionRelease(completion);
  endLoop(device);
  EXPECT_EQ(loggedLines(), errors({"send response: Input/output error", "send response: No space left on device",
                          "unknown request type 3\n"}));
}

TEST_F(Type5HandlerTest, AnswerToADeviceThatWentAwayFailsWithoutEndingTheProcess) {
  FakeDevice &device = freshDevice();
  KeptCompletion kept;
  device.serve();
  device.send(makeRequest(0xE, 1, 1, 2, 3, 4));
  Record next = makeRequest(0xF, 2);
  device.send(next);
  EXPECT_EQ(device.nextRecord(), next);
  device.goAway();
  EXPECT_EQ(device.loopResult(), std::optional<int>(0));
  Type5Completion *completion = kept.take();
  ASSERT_NE(completion, nullptr);
  // A sequenced-packet socket whose other side is gone fails the write with EPIPE and raises no
  // SIGPIPE (which would end the host process); a FIFO is opened for reading too, so it always
  // has a reader.
  errno = 0;
  EXPECT_EQ(Type5CompletionInvoke(completion, 1, 2, 3), -1);
  EXPECT_EQ(errno, EPIPE);
  Type5CompletionRelease(completion);
  EXPECT_EQ(loggedLines(), errors({"read request: Success", "unknown request type 0\n", "send response: Broken pipe"}));
}

TEST_F(Type5HandlerTest, DeviceThatCannotBeOpenedIsLogged) {
  {
    SCOPED_TRACE("missing");
    EXPECT_EQ(type5_handler_function(&kCallbacks), 0);
    EXPECT_EQ(loggedLines(), errors({"plzc open: No such file or directory"}));
  }
  {
    SCOPED_TRACE("socket nobody listens on");
    clearLog();
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
    int stale = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
    ASSERT_EQ(bind(stale, reinterpret_cast<sockaddr *>(&address), sizeof address), 0) << strerror(errno);
    close(stale);
    EXPECT_EQ(type5_handler_function(&kCallbacks), 0);
    EXPECT_EQ(loggedLines(), errors({"plzc open: Connection refused"}));
    unlink(path_.c_str());
  }
  {
    SCOPED_TRACE("open refused");
    clearLog();
    FakeDevice &device = freshDevice();
    sys::armFault(sys::Call::Open, 1, EACCES);
    device.serve();
    EXPECT_EQ(device.loopResult(), std::optional<int>(0));
    EXPECT_FALSE(device.everConnected());
    EXPECT_EQ(loggedLines(), errors({"plzc open: Permission denied"}));
  }
}

TEST_F(Type5HandlerTest, AllocationFailureEndsTheLoopWithTheFailedStepsMessage) {
  {
    SCOPED_TRACE("before opening");
    FakeDevice &device = freshDevice();
    sys::armFault(sys::Call::Malloc, 1, ENOMEM);
    device.serve();
    EXPECT_EQ(device.loopResult(), std::optional<int>(0));
    EXPECT_FALSE(device.everConnected());
    EXPECT_EQ(loggedLines(), errors({"plzc open: Cannot allocate memory"}));
  }
  {
    SCOPED_TRACE("second request's record");
    clearLog();
    FakeDevice &device = freshDevice();
    // The device link, the first request's record, then the second's.
    sys::armFault(sys::Call::Malloc, 3, ENOMEM);
    device.serve();
    Record request = makeRequest(0x1, 2, 1, 2, 3, 4);
    device.send(request);
    EXPECT_EQ(device.nextRecord(), request);
    EXPECT_EQ(device.loopResult(), std::optional<int>(0));
    EXPECT_TRUE(device.closedByLibrary());
    EXPECT_EQ(loggedLines(), errors({"read request: Cannot allocate memory", "unknown request type 0\n"}));
  }
}

// ---- The fixed device path --------------------------------------------------------------------

TEST_F(Type5HandlerTest, ServesASocketAtTheFixedDevicePath) {
  plzc::setType5DevicePath(nullptr);
  ASSERT_STREQ(plzc::type5DevicePath(), "/dev/plzc_type5");
  // Runs of this test in other processes (other build trees, sanitizer builds) take turns.
  int turn = open("/tmp/plzc_type5.test-lock", O_CREAT | O_RDONLY | O_CLOEXEC, 0666);
  ASSERT_GE(turn, 0) << strerror(errno);
  ASSERT_EQ(flock(turn, LOCK_EX), 0) << strerror(errno);
  struct stat status;
  if (lstat(plzc::kType5DevicePath, &status) == 0) {
    if (!S_ISSOCK(status.st_mode)) {
      close(turn);
      FAIL() << plzc::kType5DevicePath << " exists and is not a socket; it is left alone";
    }
    unlink(plzc::kType5DevicePath);  // left by an interrupted run
  }
  {
    FakeDevice device(plzc::kType5DevicePath);
    if (!device.listening()) {
      close(turn);
      if (geteuid() != 0) GTEST_SKIP() << device.error() << " (not root)";
      FAIL() << device.error();
    }
    device.serve();
    Record request = makeRequest(0x5EED, 2, 1, 2, 3, 4);
    device.send(request);
    EXPECT_EQ(device.nextRecord(), request);
    endLoop(device);
  }
  EXPECT_NE(access(plzc::kType5DevicePath, F_OK), 0) << "the test's socket was left behind";
  close(turn);
}

}  // namespace
