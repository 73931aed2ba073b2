// The installation as a program that uses the library sees it: `cmake --install` of this build
// tree into a fresh prefix, then a small C program built against it through pkg-config and
// through the CMake package, run on a real file. The build tree is $PLZC_BUILD_DIR, or the one
// that holds this test program.
#include <sys/stat.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include "Support/TestSupport.h"

using namespace plzctest;
using ::testing::HasSubstr;
using ::testing::StartsWith;

namespace fs = std::filesystem;

namespace {

std::string buildDir() {
  if (const char *configured = getenv("PLZC_BUILD_DIR")) return configured;
  return fs::read_symlink("/proc/self/exe").parent_path().parent_path().string();
}

std::string shellQuoted(const std::string &text) { return "'" + text + "'"; }

// A value of the build tree's cache ("PLZC_SANITIZE:STRING"), or "".
std::string cacheValue(const std::string &key) {
  std::ifstream cache(buildDir() + "/CMakeCache.txt");
  std::string line;
  while (std::getline(cache, line))
    if (line.rfind(key + "=", 0) == 0) return line.substr(key.size() + 1);
  return "";
}

// A sanitized library can only be used by a program built with the same sanitizers.
std::string sanitizerFlags() {
  std::string sanitizers = cacheValue("PLZC_SANITIZE:STRING");
  return sanitizers.empty() ? "" : "-fsanitize=" + sanitizers;
}

// Compresses the file named on its command line through the exported calls, checks what the
// query says, and decompresses it again.
const char kProgram[] = R"(#include <Plenzo.h>
#include <stdio.h>

int main(int argc, char **argv) {
  if (argc != 2) return 64;
  if (!VolumeSupportsCompression(argv[1])) return 65;
  CompressorContext *ctx = initCompressor("3,4", NULL, NULL, NULL, true, 5, false);
  if (!ctx) return 66;
  int compressed = compressFile(ctx, argv[1], NULL);
  freeCompressor(ctx);
  if (compressed != 0) return 67;
  CompressionInfo info;
  if (queryCompressionInfo(argv[1], &info) != 0) return 68;
  printf("type %u, %llu bytes in %llu\n", info.compressionType, (unsigned long long)info.uncompressedSize,
         (unsigned long long)info.compressedSize);
  if (decompressFile(argv[1], true, 0) != 0) return 69;
  if (queryCompressionInfo(argv[1], &info) != 0 || info.compressionType != 0) return 70;
  return 0;
}
)";

class Install : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(dir.path().empty());
    prefix = dir.file("prefix");
    int status = -1;
    std::string output = runCommand("cmake --install " + shellQuoted(buildDir()) + " --prefix " + shellQuoted(prefix) + " 2>&1",
                                    &status);
    ASSERT_EQ(status, 0) << output;
    for (const auto &entry : fs::recursive_directory_iterator(prefix))
      if (entry.path().filename() == "libplenzo.so") libDir = entry.path().parent_path().string();
    ASSERT_FALSE(libDir.empty()) << "no libplenzo.so under " << prefix << ":\n" << output;
    std::ofstream(dir.file("use.c")) << kProgram;
  }

  // Runs the program on a compressible file, which must end as it began.
  void runProgram(const std::string &program) {
    std::vector<uint8_t> bytes;
    for (int i = 0; bytes.size() < 300000; i++) {
      std::string line = "line " + std::to_string(i) + " of a file that compresses well\n";
      bytes.insert(bytes.end(), line.begin(), line.end());
    }
    std::string file = writeFile(dir.file("data.txt"), bytes);
    int status = -1;
    std::string output = runCommand("LD_LIBRARY_PATH=" + shellQuoted(libDir) + " " + shellQuoted(program) + " " + shellQuoted(file) +
                                        " 2>/dev/null",
                                    &status);
    EXPECT_EQ(status, 0) << output;
    std::string expected = "type 4, " + std::to_string(bytes.size()) + " bytes in ";
    ASSERT_THAT(output, StartsWith(expected));
    unsigned long long stored = std::stoull(output.substr(expected.size()));
    EXPECT_GT(stored, 0u);
    EXPECT_LT(stored, bytes.size() / 2) << "text this regular shrinks to far less than half";
    EXPECT_EQ(readFile(file), bytes);
  }

  ScratchDir dir;
  std::string prefix, libDir;
};

TEST_F(Install, PutsTheLibraryHeadersToolResourcesAndPackageFilesInThePrefix) {
  for (const std::string &path :
       {prefix + "/bin/plzc", libDir + "/libplenzo.so.0", prefix + "/include/plenzo/Plenzo.h",
        prefix + "/include/plenzo/PropertyValue.h", libDir + "/pkgconfig/plenzo.pc",
        libDir + "/cmake/Plenzo/PlenzoConfig.cmake", libDir + "/cmake/Plenzo/PlenzoConfigVersion.cmake",
        libDir + "/cmake/Plenzo/PlenzoTargets.cmake"})
    EXPECT_TRUE(fs::is_regular_file(path)) << path;
  // Every resource of the bundle, unchanged.
  std::string sourceResources = cacheValue("Plenzo_SOURCE_DIR:STATIC") + "/Resources";
  ASSERT_TRUE(fs::is_directory(sourceResources)) << sourceResources;
  size_t resources = 0;
  for (const auto &entry : fs::directory_iterator(sourceResources)) {
    std::string installed = prefix + "/share/com.tavix.Plenzo/" + entry.path().filename().string();
    EXPECT_EQ(readFile(installed), readFile(entry.path().string())) << installed;
    resources++;
  }
  EXPECT_GT(resources, 0u);

  int status = -1;
  std::string version = runCommand(shellQuoted(prefix + "/bin/plzc") + " --version", &status);
  EXPECT_EQ(status, 0);
  EXPECT_THAT(version, StartsWith("plzc (Plenzo) "));
  std::string volume = runCommand(shellQuoted(prefix + "/bin/plzc") + " volume " + shellQuoted(dir.path()), &status);
  EXPECT_EQ(status, 0) << volume;
}

TEST_F(Install, ACProgramBuildsThroughPkgConfigAndRuns) {
  std::string environment = "PKG_CONFIG_PATH=" + shellQuoted(libDir + "/pkgconfig") + " ";
  int status = -1;
  std::string flags = runCommand(environment + "pkg-config --cflags --libs plenzo 2>&1", &status);
  ASSERT_EQ(status, 0) << flags;
  EXPECT_THAT(flags, HasSubstr("-lplenzo"));
  std::string version = runCommand(environment + "pkg-config --modversion plenzo", &status);
  EXPECT_EQ(status, 0);
  EXPECT_FALSE(version.empty());

  std::string program = dir.file("use-pkg-config");
  std::string output = runCommand("cc -std=c11 -Wall -Werror " + sanitizerFlags() + " -o " + shellQuoted(program) + " " +
                                      shellQuoted(dir.file("use.c")) + " $(" + environment +
                                      "pkg-config --cflags --libs plenzo) 2>&1",
                                  &status);
  ASSERT_EQ(status, 0) << output;
  runProgram(program);
}

TEST_F(Install, ACProgramBuildsThroughTheCMakePackageAndRuns) {
  std::string source = dir.file("project");
  fs::create_directories(source);
  fs::rename(dir.file("use.c"), source + "/use.c");
  std::ofstream(source + "/CMakeLists.txt") << "cmake_minimum_required(VERSION 3.25)\n"
                                               "project(UsePlenzo C)\n"
                                               "find_package(Plenzo 0.1 CONFIG REQUIRED)\n"
                                               "add_executable(use use.c)\n"
                                               "target_link_libraries(use PRIVATE Plenzo::plenzo)\n";
  std::string binary = dir.file("project-build");
  int status = -1;
  std::string output = runCommand("cmake -S " + shellQuoted(source) + " -B " + shellQuoted(binary) + " -G Ninja -DCMAKE_PREFIX_PATH=" +
                                      shellQuoted(prefix) + " -DCMAKE_C_FLAGS=" + shellQuoted(sanitizerFlags()) + " 2>&1 && cmake --build " +
                                      shellQuoted(binary) + " 2>&1",
                                  &status);
  ASSERT_EQ(status, 0) << output;
  runProgram(binary + "/use");
}

}  // namespace
