#include "Libraries/CompressData/CompressedReader.h"

#include <cerrno>
#include <cstring>

#include "Common/ThrottlingAllocator.h"
#include "Libraries/CompressData/CompressorRegistry.h"
#include "Platform/ExtendedAttributes.h"

namespace plzc {

CompressedReader::Status CompressedReader::open(FileHandle *fh, std::unique_ptr<CompressedReader> *reader,
                                                Found *found) {
  reader->reset();
  Found ignored;
  if (!found) found = &ignored;
  *found = {};
  int options = osSupportsDecmpfs() ? kShowCompressionOption : 0;
  // Most headers are small (type 4's is 16 bytes, small files' whole data a few KiB): one read
  // into a first buffer usually gets the whole attribute, and its length with it.
  uint8_t first[4096];
  int64_t size = fh->getxattr(fh, kDecmpfsXattrName, first, sizeof first, 0, options);
  bool haveBytes = size >= 0;
  if (size == -1 && errno == ERANGE) size = fh->getxattr(fh, kDecmpfsXattrName, nullptr, 0, 0, options);
  if (size == -1) return Status::Unreadable;
  found->attributeSize = size;
  if (size < 0 || size > kMaxReadableHeaderSize) {
    errno = EINVAL;
    return Status::Oversized;
  }
  uint64_t blockSize = static_cast<uint64_t>(size) + sizeof(AttrBuffer);
  auto *block = static_cast<AttrBuffer *>(waitThenAllocate(blockSize, 0));
  if (!block) return Status::NoMemory;
  std::unique_ptr<CompressedReader> made(new CompressedReader);
  made->fh_ = fh;
  made->attribute_ = block;
  made->attributeBlockSize_ = blockSize;
  if (haveBytes)
    memcpy(block->attribute, first, static_cast<size_t>(size));
  else if (fh->getxattr(fh, kDecmpfsXattrName, block->attribute, static_cast<uint64_t>(size), 0, options) != size)
    return Status::Unreadable;
  block->attrSize = static_cast<uint32_t>(size);
  if (size < static_cast<int64_t>(sizeof(DiskHeader))) return Status::ShortHeader;
  memcpy(&made->header_, block->attribute, sizeof(DiskHeader));
  found->header = made->header_;
  if (made->header_.magic != kDecmpfsMagic) return Status::WrongMagic;
  made->row_ = compressorForReading(made->header_.compressionType);
  if (!made->row_ || made->row_->chunkSize == 0) return Status::UnsupportedType;
  made->chunkSize_ = made->row_->chunkSize;
  *reader = std::move(made);
  return Status::Ok;
}

CompressedReader::~CompressedReader() {
  if (attribute_) freeAndSignal(attribute_, attributeBlockSize_);
}

uint32_t CompressedReader::chunkLength(uint64_t index) const {
  if (index >= chunkCount()) return 0;
  uint64_t start = index * chunkSize_;
  uint64_t left = header_.uncompressedSize - start;
  return left < chunkSize_ ? static_cast<uint32_t>(left) : chunkSize_;
}

int64_t CompressedReader::read(int64_t offset, uint64_t count, uint8_t *out) const {
  // The fork is read in small pieces (table entries, chunks): keep the segments they fall in.
  platform::XattrReadCache segmentCache;
  struct iovec vector = {out, static_cast<size_t>(count)};
  return row_->doUncompress(fh_, offset, count, 1, &vector, attribute_);
}

int64_t CompressedReader::readChunk(uint64_t index, uint8_t *out) const {
  uint32_t length = chunkLength(index);
  if (length == 0) {
    errno = EIO;
    return -1;
  }
  int64_t produced = read(static_cast<int64_t>(index * chunkSize_), length, out);
  if (produced != static_cast<int64_t>(length)) {
    // A chunk that decodes short is as damaged as one that does not decode.
    errno = EIO;
    return -1;
  }
  return produced;
}

}  // namespace plzc
