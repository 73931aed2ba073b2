#include "TestSupport.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <thread>

#include "Plenzo.h"

namespace plzctest {

namespace {

std::string testRoot() {
  const char *configured = getenv("PLZC_TEST_DIR");
  return configured && *configured ? configured : "/dev/shm";
}

// Can a file in dir hold one Linux attribute of 64 KiB?
bool holdsLargeAttributes(const std::string &dir) {
  std::string probe = dir + "/.plzc-probe";
  int fd = open(probe.c_str(), O_CREAT | O_RDWR | O_TRUNC, 0600);
  if (fd < 0) return false;
  std::vector<char> value(65536, 'p');
  bool ok = fsetxattr(fd, "user.plzc-probe", value.data(), value.size(), 0) == 0;
  close(fd);
  unlink(probe.c_str());
  return ok;
}

}  // namespace

ScratchDir::ScratchDir() {
  std::string root = testRoot();
  if (!holdsLargeAttributes(root)) {
    ADD_FAILURE() << "the test volume " << root
                  << " cannot hold 64 KiB extended attributes; set PLZC_TEST_DIR to a directory on "
                     "tmpfs (Linux 6.6 or later), XFS, btrfs or ext4 made with -O ea_inode";
    return;
  }
  std::string pattern = root + "/plzc-test-XXXXXX";
  std::vector<char> buffer(pattern.begin(), pattern.end());
  buffer.push_back('\0');
  if (!mkdtemp(buffer.data())) {
    ADD_FAILURE() << "mkdtemp " << pattern << ": " << strerror(errno);
    return;
  }
  path_ = buffer.data();
}

ScratchDir::~ScratchDir() {
  if (path_.empty()) return;
  std::error_code ignored;
  // Files may carry the immutable flags of the library; they are only recorded, so removal works.
  std::filesystem::permissions(path_, std::filesystem::perms::owner_all, std::filesystem::perm_options::add, ignored);
  std::filesystem::remove_all(path_, ignored);
}

std::string ScratchDir::file(const std::string &name) const { return path_ + "/" + name; }

std::string writeFile(const std::string &path, const std::vector<uint8_t> &bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(reinterpret_cast<const char *>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
  EXPECT_TRUE(out.good()) << "cannot write " << path;
  return path;
}

std::string writeFile(const std::string &path, const std::string &text) {
  return writeFile(path, std::vector<uint8_t>(text.begin(), text.end()));
}

std::vector<uint8_t> readFile(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  return std::vector<uint8_t>(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

std::string catFileTo(const std::string &path, const std::function<void(const uint8_t *, size_t)> &sink) {
  int pipeFds[2];
  if (pipe2(pipeFds, O_CLOEXEC) != 0) return std::string("pipe: ") + strerror(errno);
  fflush(stdout);
  int savedOut = fcntl(1, F_DUPFD_CLOEXEC, 3);
  dup2(pipeFds[1], 1);
  close(pipeFds[1]);
  FdCapture errors(2);
  // catFile writes into the pipe while this thread drains it; putting descriptor 1 back closes
  // the pipe's last write end, which ends the reading.
  std::thread writer([&] {
    catFile(path.c_str(), 0);
    fflush(stdout);
    dup2(savedOut, 1);
    close(savedOut);
  });
  std::vector<uint8_t> buffer(1 << 20);
  for (;;) {
    ssize_t got = read(pipeFds[0], buffer.data(), buffer.size());
    if (got < 0 && errno == EINTR) continue;
    if (got <= 0) break;
    sink(buffer.data(), static_cast<size_t>(got));
  }
  writer.join();
  close(pipeFds[0]);
  return errors.text();
}

std::vector<std::string> linuxAttributeNames(const std::string &path) {
  ssize_t size = llistxattr(path.c_str(), nullptr, 0);
  if (size <= 0) return {};
  std::vector<char> list(static_cast<size_t>(size));
  size = llistxattr(path.c_str(), list.data(), list.size());
  std::vector<std::string> names;
  for (ssize_t at = 0; at < size;) {
    names.emplace_back(&list[static_cast<size_t>(at)]);
    at += static_cast<ssize_t>(names.back().size()) + 1;
  }
  return names;
}

std::string runCommand(const std::string &command, int *status) {
  std::string output;
  FILE *pipe = popen(command.c_str(), "r");
  if (!pipe) {
    if (status) *status = -1;
    return output;
  }
  char buffer[4096];
  size_t got;
  while ((got = fread(buffer, 1, sizeof buffer, pipe)) > 0) output.append(buffer, got);
  int result = pclose(pipe);
  if (status) *status = WIFEXITED(result) ? WEXITSTATUS(result) : -1;
  return output;
}

bool runningAsRoot() { return geteuid() == 0; }

FdCapture::FdCapture(int fd) : fd_(fd) {
  fflush(nullptr);
  saved_ = dup(fd);
  sink_ = memfd_create("capture", 0);
  dup2(sink_, fd);
}

FdCapture::~FdCapture() {
  text();
  close(sink_);
}

std::string FdCapture::text() {
  if (saved_ >= 0) {
    fflush(nullptr);
    dup2(saved_, fd_);
    close(saved_);
    saved_ = -1;
  }
  std::string out;
  char buffer[65536];
  ssize_t got;
  while ((got = pread(sink_, buffer, sizeof buffer, static_cast<off_t>(out.size()))) > 0)
    out.append(buffer, static_cast<size_t>(got));
  return out;
}

TemporaryMount TemporaryMount::ext4WithoutLargeAttributes(const std::string &parentDir) {
  TemporaryMount mount;
  mount.image_ = parentDir + "/ext4.img";
  mount.mountPoint_ = parentDir + "/ext4";
  mkdir(mount.mountPoint_.c_str(), 0755);
  int status = 0;
  std::string output = runCommand("truncate -s 32M '" + mount.image_ + "' && mkfs.ext4 -q -F -O ^ea_inode '" +
                                      mount.image_ + "' 2>&1 && mount -o loop '" + mount.image_ + "' '" +
                                      mount.mountPoint_ + "' 2>&1",
                                  &status);
  EXPECT_EQ(status, 0) << "cannot make and mount an ext4 image: " << output;
  mount.mounted_ = status == 0;
  return mount;
}

TemporaryMount TemporaryMount::tmpfs(const std::string &parentDir, const std::string &size) {
  return tmpfsWithOptions(parentDir, "size=" + size);
}

TemporaryMount TemporaryMount::tmpfsWithOptions(const std::string &parentDir, const std::string &options) {
  TemporaryMount mount;
  mount.mountPoint_ = parentDir + "/tmpfs";
  mkdir(mount.mountPoint_.c_str(), 0755);
  int result = ::mount("tmpfs", mount.mountPoint_.c_str(), "tmpfs", 0, options.c_str());
  EXPECT_EQ(result, 0) << "mount tmpfs on " << mount.mountPoint_ << ": " << strerror(errno);
  mount.mounted_ = result == 0;
  return mount;
}

TemporaryMount::TemporaryMount(TemporaryMount &&other) noexcept
    : mountPoint_(std::move(other.mountPoint_)), image_(std::move(other.image_)), mounted_(other.mounted_) {
  other.mounted_ = false;
  other.image_.clear();
}

TemporaryMount::~TemporaryMount() {
  if (mounted_ && umount2(mountPoint_.c_str(), MNT_DETACH) != 0)
    fprintf(stderr, "umount %s: %s\n", mountPoint_.c_str(), strerror(errno));
  if (!image_.empty()) unlink(image_.c_str());
  if (!mountPoint_.empty()) rmdir(mountPoint_.c_str());
}

}  // namespace plzctest
