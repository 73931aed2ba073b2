// Walking a directory tree, or a list of paths, one regular file at a time, once per inode.
#include <fcntl.h>
#include <fts.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>

#include "Libraries/CompressData/FileEnumerator.h"

#include "Common/Diagnostics.h"
#include "Platform/Syscalls.h"
#include "Plenzo.h"
#include "PropertyValue.h"

static constexpr char kSourcePath[] = "Libraries/CompressData/FileEnumerator";

namespace {

constexpr size_t kLineSize = 1028;

struct FileListState {
  const char *list;
  char *prefix;
  char *joinedPath;
  int32_t fd;
  int32_t position;
  int32_t listSize;
  char line[kLineSize];
};

}  // namespace

struct FileEnumerator {
  PVMutableDictionaryRef visited;  // inode number -> owned copy of the first path
  void *walker;                    // FTS * or FileListState *
};

namespace {

FileEnumerator *newEnumerator() {
  auto *enumerator = static_cast<FileEnumerator *>(sys::calloc(1, sizeof(FileEnumerator)));
  if (!enumerator) return nullptr;
  enumerator->visited = PVDictionaryCreateMutable(0, kPVDictionaryPlainValues);
  if (!enumerator->visited) {
    free(enumerator);
    return nullptr;
  }
  return enumerator;
}

void freeRememberedPath(PVRef, const void *value, void *) { free(const_cast<void *>(value)); }

void releaseVisited(FileEnumerator *enumerator) {
  PVDictionaryApply(enumerator->visited, freeRememberedPath, nullptr);
  PVRelease(enumerator->visited);
}

}  // namespace

int compressorVisitFile(FileEnumerator *enumerator, uint64_t inode, const char *path) {
  PVNumberRef key = PVNumberCreateInt64(static_cast<int64_t>(inode));
  if (!key) return 1;
  int result;
  const void *remembered;
  if (PVDictionaryGetValueIfPresent(enumerator->visited, key, &remembered)) {
    printf("already visited %s as %s\n", path, static_cast<const char *>(remembered));
    fflush(stdout);
    result = 0;
  } else {
    char *copy = sys::strdup(path);
    if (copy && !PVDictionarySetValue(enumerator->visited, key, copy)) free(copy);
    result = 1;
  }
  PVRelease(key);
  return result;
}

FileEnumerator *initFileEnumeratorFromDir(const char *path) {
  char resolved[PATH_MAX];
  if (!sys::realpath(path, resolved)) {
    PLZC_ERR("%s:%d: realpath %s: %s\n", path, strerror(errno));
    return nullptr;
  }
  char *roots[] = {resolved, nullptr};
  FTS *walk = fts_open(roots, FTS_NOCHDIR | FTS_PHYSICAL | FTS_XDEV, nullptr);
  if (!walk) {
    PLZC_ERR("%s:%d: fts_open %s: %s\n", resolved, strerror(errno));
    return nullptr;
  }
  FileEnumerator *enumerator = newEnumerator();
  if (!enumerator) {
    fts_close(walk);
    return nullptr;
  }
  enumerator->walker = walk;
  return enumerator;
}

int enumFilesFromDir(FileEnumerator *enumerator, const char **pathOut) {
  return enumFilesFromDirReporting(enumerator, pathOut, nullptr, nullptr);
}

int enumFilesFromDirReporting(FileEnumerator *enumerator, const char **pathOut, EnumProblemHandler problem,
                              void *context) {
  auto *walk = static_cast<FTS *>(enumerator->walker);
  while (FTSENT *entry = fts_read(walk)) {
    bool unreadable = entry->fts_info == FTS_DNR || entry->fts_info == FTS_ERR || entry->fts_info == FTS_NS;
    if (unreadable && problem) problem(entry->fts_path, entry->fts_errno, context);
    if (entry->fts_info != FTS_F) continue;
    if (entry->fts_statp->st_nlink >= 2 && !compressorVisitFile(enumerator, entry->fts_statp->st_ino, entry->fts_path))
      continue;
    *pathOut = entry->fts_path;
    return 1;
  }
  return 0;
}

void freeFileEnumeratorFromDir(FileEnumerator *enumerator) {
  if (!enumerator) return;
  releaseVisited(enumerator);
  fts_close(static_cast<FTS *>(enumerator->walker));
  free(enumerator);
}

FileEnumerator *initFileEnumeratorFromFileList(const char *listPath, const char *prefix) {
  FileEnumerator *enumerator = newEnumerator();
  auto *state = static_cast<FileListState *>(sys::calloc(1, sizeof(FileListState)));
  if (!enumerator || !state) {
    if (enumerator) releaseVisited(enumerator);
    free(enumerator);
    free(state);
    return nullptr;
  }
  enumerator->walker = state;
  state->fd = sys::open(listPath, O_RDONLY, 0);
  if (state->fd < 0) {
    PLZC_ERR("%s:%d: open %s: %s\n", listPath, strerror(errno));
    free(state);
    releaseVisited(enumerator);
    free(enumerator);
    return nullptr;
  }
  struct stat st;
  bool usable = sys::fstat(state->fd, &st) == 0;
  if (usable && st.st_size > INT32_MAX) {
    errno = EFBIG;  // positions in the list are 32-bit
    usable = false;
  }
  if (usable && st.st_size > 0) {
    void *mapped = mmap(nullptr, static_cast<size_t>(st.st_size), PROT_READ, MAP_PRIVATE, state->fd, 0);
    usable = mapped != MAP_FAILED;
    if (usable) state->list = static_cast<const char *>(mapped);
  }
  if (!usable) {
    PLZC_ERR("%s:%d: open %s: %s\n", listPath, strerror(errno));
    sys::close(state->fd);
    free(state);
    releaseVisited(enumerator);
    free(enumerator);
    return nullptr;
  }
  state->listSize = static_cast<int32_t>(st.st_size);
  if (prefix) {
    state->prefix = sys::strdup(prefix);
    size_t length = state->prefix ? strlen(state->prefix) : 0;
    if (length > 0 && state->prefix[length - 1] == '/') state->prefix[length - 1] = '\0';
  }
  return enumerator;
}

int enumFilesFromFileList(FileEnumerator *enumerator, const char **pathOut) {
  auto *state = static_cast<FileListState *>(enumerator->walker);
  while (state->position < state->listSize) {
    const char *start = state->list + state->position;
    size_t available = static_cast<size_t>(state->listSize - state->position);
    const char *newline = static_cast<const char *>(memchr(start, '\n', available));
    size_t length = newline ? static_cast<size_t>(newline - start) : available;
    state->position += static_cast<int32_t>(length + (newline ? 1 : 0));
    if (length >= kLineSize) {
      // The list format has no continuation: a path this long cannot be one of ours.
      PLZC_ERR("%s:%d: line too long (%zu bytes), skipped: %.64s...\n", length, start);
      continue;
    }
    memcpy(state->line, start, length);
    state->line[length] = '\0';

    const char *examined = state->line;
    if (state->prefix) {
      free(state->joinedPath);
      state->joinedPath = nullptr;
      if (asprintf(&state->joinedPath, state->line[0] == '/' ? "%s%s" : "%s/%s", state->prefix, state->line) < 0) {
        state->joinedPath = nullptr;
        continue;
      }
      examined = state->joinedPath;
    }
    struct stat st;
    if (sys::stat(examined, &st) != 0) {
      PLZC_ERR("%s:%d: stat: %s\n", strerror(errno));
      continue;
    }
    if (!S_ISREG(st.st_mode)) {
      printf("%s is not a file\n", examined);
      fflush(stdout);
      continue;
    }
    if (st.st_nlink >= 2 && !compressorVisitFile(enumerator, st.st_ino, state->line)) continue;
    *pathOut = state->line;
    return 1;
  }
  return 0;
}

void freeFileEnumeratorFromFileList(FileEnumerator *enumerator) {
  if (!enumerator) return;
  auto *state = static_cast<FileListState *>(enumerator->walker);
  if (state->list) munmap(const_cast<char *>(state->list), static_cast<size_t>(state->listSize));
  sys::close(state->fd);
  free(state->prefix);
  free(state->joinedPath);
  free(state);
  releaseVisited(enumerator);
  free(enumerator);
}
