// Fuzz target: the 48-byte request records of the type-5 device, served by
// type5_handler_function. The target plays the device on a sequenced-packet socket: it sends
// the input's packets (any length: short packets, long ones, empty ones), and checks that the
// answers are exactly those the requests call for: type 2 echoed, type 1 answered by its
// completion with the values crossed, the loop ended by any other type or by end of file.
//
// Input: packets, each a u8 length (taken modulo 65) and that many bytes. value4 & 3 of a
// type-1 request tells its handler what to do: 0 answer at once, 1 keep a copy and answer once
// the loop has ended, 2 never answer, 3 both answer at once and keep a copy.
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <string>
#include <thread>
#include <vector>

#include "FuzzSupport.h"
#include "Platform/SystemLog.h"
#include "Platform/Type5Device.h"
#include "Plenzo.h"

using namespace plzcfuzz;

namespace {

constexpr size_t kRecordSize = 48;
constexpr size_t kMaxPacket = 64;
using Record = std::array<uint8_t, kRecordSize>;

uint64_t field(const Record &record, size_t offset) {
  uint64_t value;
  memcpy(&value, record.data() + offset, sizeof value);
  return value;
}

void setField(Record *record, size_t offset, uint64_t value) { memcpy(record->data() + offset, &value, sizeof value); }

// The values a completion answers with, from its request's own values.
void answerValues(uint64_t value1, uint64_t value2, uint64_t value3, uint64_t *r1, uint64_t *r2, uint64_t *r3) {
  *r1 = value1 ^ 0x1111;
  *r2 = value2 + 2;
  *r3 = ~value3;
}

// The answer a completion writes: r1 at 16, r3 at 24, r2 at 32, the rest as received.
Record expectedAnswer(const Record &request) {
  uint64_t r1, r2, r3;
  answerValues(field(request, 16), field(request, 24), field(request, 32), &r1, &r2, &r3);
  Record answer = request;
  setField(&answer, 16, r1);
  setField(&answer, 24, r3);
  setField(&answer, 32, r2);
  return answer;
}

// A completion the type-1 handler keeps, with the values it is to answer with.
struct Kept {
  Type5Completion *completion;
  uint64_t r1, r2, r3;
};
// The loop runs on one thread at a time, and the target reads this only after it has ended.
std::vector<Kept> gKept;

int onType1(uint64_t value1, uint64_t value2, uint64_t value3, uint64_t value4, Type5Completion *completion) {
  uint64_t r1, r2, r3;
  answerValues(value1, value2, value3, &r1, &r2, &r3);
  if ((value4 & 3) == 0 || (value4 & 3) == 3)
    FUZZ_CHECK(Type5CompletionInvoke(completion, r1, r2, r3) == 0, "answer failed: %s", strerror(errno));
  if ((value4 & 3) == 1 || (value4 & 3) == 3) gKept.push_back({Type5CompletionCopy(completion), r1, r2, r3});
  return 0;
}

// The loop reports to the system log only, at error priority; the text is formatted and dropped.
void logSink(int priority, const char *format, va_list arguments) {
  FUZZ_CHECK(priority == LOG_ERR, "logged at priority %d", priority);
  char text[512];
  vsnprintf(text, sizeof text, format, arguments);
}

int onType2(uint64_t, uint64_t) { return 0; }

constexpr Type5Callbacks kCallbacks = {onType1, onType2};

// The device's listening socket, made once per process.
int listener() {
  static int fd = [] {
    static std::string path = scratchDir() + "/plzc_type5";
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    FUZZ_CHECK(path.size() < sizeof address.sun_path, "socket path too long: %s", path.c_str());
    memcpy(address.sun_path, path.c_str(), path.size() + 1);
    int made = socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0);
    FUZZ_CHECK(
        made >= 0 && bind(made, reinterpret_cast<sockaddr *>(&address), sizeof address) == 0 && listen(made, 4) == 0,
        "cannot listen at %s: %s", path.c_str(), strerror(errno));
    plzc::setType5DevicePath(path.c_str());
    plzc::setSystemLogSink(logSink);
    return made;
  }();
  return fd;
}

// What the loop must answer, in order: its own answers as it reads, then the kept ones.
// *read gets the number of packets it reads before it ends.
std::vector<Record> expectedAnswers(const std::vector<Bytes> &packets, size_t *read) {
  std::vector<Record> now, later;
  for (size_t i = 0;; i++) {
    *read = std::min(i + 1, packets.size());
    Record request{};
    // A packet fills the record as far as it goes; end of file leaves it zero.
    if (i < packets.size()) std::copy_n(packets[i].begin(), std::min(packets[i].size(), kRecordSize), request.begin());
    auto type = static_cast<int64_t>(field(request, 8));
    if (type == 2) {
      now.push_back(request);
    } else if (type == 1) {
      uint64_t behaviour = field(request, 40) & 3;
      if (behaviour == 0 || behaviour == 3) now.push_back(expectedAnswer(request));
      if (behaviour == 1 || behaviour == 3) later.push_back(expectedAnswer(request));
    } else {
      break;
    }
    if (i >= packets.size()) break;  // end of file
  }
  now.insert(now.end(), later.begin(), later.end());
  return now;
}

// Receives every answer waiting on the socket.
void drain(int peer, std::vector<Bytes> *answers) {
  for (;;) {
    Bytes packet(256);
    ssize_t got = recv(peer, packet.data(), packet.size(), MSG_DONTWAIT);
    if (got <= 0) return;
    packet.resize(static_cast<size_t>(got));
    answers->push_back(std::move(packet));
  }
}

Bytes request(int64_t type, uint64_t value1, uint64_t value2, uint64_t value3, uint64_t value4) {
  return InputWriter()
      .u64(0x5052515354555657)
      .u64(static_cast<uint64_t>(type))
      .u64(value1)
      .u64(value2)
      .u64(value3)
      .u64(value4)
      .data();
}

Bytes packets(const std::vector<Bytes> &list) {
  InputWriter out;
  for (const Bytes &packet : list) out.u8(static_cast<uint8_t>(packet.size())).bytes(packet);
  return out.data();
}

void writeSeeds(SeedSink &seeds) {
  seeds.add("every-behaviour", packets({request(2, 7, 9, 0, 0), request(1, 10, 20, 30, 0), request(1, 11, 21, 31, 1),
                                        request(1, 12, 22, 32, 2), request(1, 13, 23, 33, 3), request(3, 0, 0, 0, 0)}));
  seeds.add("end-of-file", packets({request(1, 1, 2, 3, 1), request(2, 4, 5, 6, 7)}));
  Bytes shortPacket = request(2, 1, 2, 3, 4);
  shortPacket.resize(30);
  Bytes longPacket = request(1, 5, 6, 7, 0);
  longPacket.resize(60, 0xEE);
  seeds.add("odd-sizes", packets({shortPacket, longPacket, Bytes(), request(2, 8, 9, 0, 0)}));
}

}  // namespace

PLZC_FUZZ_SEEDS(writeSeeds)

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
  InputReader input(data, size);
  std::vector<Bytes> packets;
  while (input.remaining() > 0) packets.push_back(input.bytes(input.u8() % (kMaxPacket + 1)));

  // Only the packets the loop reads are sent: a socket closed with packets unread resets the
  // connection, and the answers still on their way would be lost.
  size_t read = 0;
  std::vector<Record> expected = expectedAnswers(packets, &read);
  packets.resize(read);

  int listening = listener();
  std::atomic<bool> loopEnded{false};
  int loopResult = -1;
  std::thread loop([&] {
    loopResult = type5_handler_function(&kCallbacks);
    loopEnded = true;
  });
  int peer = -1;
  while (peer < 0 && !loopEnded) {
    pollfd waiting = {listening, POLLIN, 0};
    if (poll(&waiting, 1, 10) == 1) peer = accept4(listening, nullptr, nullptr, SOCK_CLOEXEC);
  }
  FUZZ_CHECK(peer >= 0, "the loop never connected");

  // Requests go out while answers come back, so that neither side's buffer fills.
  std::vector<Bytes> answers;
  size_t sent = 0;
  bool hungUp = false;
  while (!loopEnded) {
    if (sent == packets.size() && !hungUp) {
      shutdown(peer, SHUT_WR);
      hungUp = true;
    }
    pollfd waiting = {peer, static_cast<short>(POLLIN | (hungUp ? 0 : POLLOUT)), 0};
    poll(&waiting, 1, 10);
    if (!hungUp && (waiting.revents & POLLOUT) &&
        send(peer, packets[sent].data(), packets[sent].size(), MSG_DONTWAIT | MSG_NOSIGNAL) >= 0)
      sent++;
    drain(peer, &answers);
  }
  loop.join();
  FUZZ_CHECK(loopResult == 0, "type5_handler_function returned %d", loopResult);
  for (const Kept &kept : gKept) {
    drain(peer, &answers);
    FUZZ_CHECK(Type5CompletionInvoke(kept.completion, kept.r1, kept.r2, kept.r3) == 0, "late answer failed: %s",
               strerror(errno));
    Type5CompletionRelease(kept.completion);
  }
  gKept.clear();
  // The loop is over and every completion released: the library has closed the device.
  for (;;) {
    pollfd waiting = {peer, POLLIN, 0};
    FUZZ_CHECK(poll(&waiting, 1, 5000) == 1, "the device was left open");
    Bytes packet(256);
    ssize_t got = recv(peer, packet.data(), packet.size(), 0);
    FUZZ_CHECK(got >= 0, "reading the answers: %s", strerror(errno));
    if (got == 0) break;
    packet.resize(static_cast<size_t>(got));
    answers.push_back(std::move(packet));
  }
  close(peer);

  FUZZ_CHECK(answers.size() == expected.size(), "%zu answers to %zu packets read, expected %zu", answers.size(),
             packets.size(), expected.size());
  for (size_t i = 0; i < answers.size(); i++)
    FUZZ_CHECK(answers[i].size() == kRecordSize && memcmp(answers[i].data(), expected[i].data(), kRecordSize) == 0,
               "answer %zu differs", i);
  return 0;
}
