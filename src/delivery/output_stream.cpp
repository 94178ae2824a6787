#include "delivery/output_stream.h"
#include "platform/strings.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <unistd.h>
#include <zlib.h>

#include <cerrno>

namespace tavix {

// ---- FileOutputStream

FileOutputStream::~FileOutputStream() { close(); }

void FileOutputStream::open() {
  if (fd_ >= 0) return;
  fd_ = ::open(path_.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC);
  if (fd_ < 0) {
    errno_ = errno;
    status_ = StreamStatus::Error;
    return;
  }
  status_ = StreamStatus::Open;
}

long FileOutputStream::write(const std::uint8_t* buffer, std::size_t length) {
  if (fd_ < 0 || status_ != StreamStatus::Open) return -1;
  std::size_t done = 0;
  while (done < length) {
    const ssize_t n = ::write(fd_, buffer + done, length - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      errno_ = errno;
      status_ = StreamStatus::Error;
      return -1;
    }
    done += static_cast<std::size_t>(n);
  }
  return static_cast<long>(done);
}

void FileOutputStream::close() {
  if (fd_ < 0) return;
  ::close(fd_);
  fd_ = -1;
  if (status_ != StreamStatus::Error) status_ = StreamStatus::Closed;
}

std::optional<std::error_code> FileOutputStream::streamError() const {
  if (status_ != StreamStatus::Error) return std::nullopt;
  return std::error_code(errno_, std::generic_category());
}

// ---- MemoryOutputStream

long MemoryOutputStream::write(const std::uint8_t* buffer, std::size_t length) {
  if (status_ != StreamStatus::Open) return -1;
  data_.append(reinterpret_cast<const char*>(buffer), length);
  return static_cast<long>(length);
}

// ---- CompressedOutputStream

struct CompressedOutputStream::Compressor {
  z_stream zs{};
  bool deflateReady = false;
  EVP_MD_CTX* sha = nullptr;

  ~Compressor() {
    if (deflateReady) deflateEnd(&zs);
    if (sha) EVP_MD_CTX_free(sha);
  }
};

CompressedOutputStream::CompressedOutputStream(std::shared_ptr<OutputStream> outputStream,
                                               std::optional<platform::fs::path> outputFile)
    : outputStream_(std::move(outputStream)), outputFile_(std::move(outputFile)),
      compressor_(std::make_unique<Compressor>()) {
  // Window bits -15: raw DEFLATE, no zlib header or Adler-32 trailer.
  compressor_->deflateReady =
      deflateInit2(&compressor_->zs, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY) == Z_OK;
  compressor_->sha = EVP_MD_CTX_new();
  const bool shaReady = compressor_->sha && EVP_DigestInit_ex(compressor_->sha, EVP_sha512(), nullptr) == 1;
  if (!compressor_->deflateReady || !shaReady || !outputStream_) status_ = -1;
}

CompressedOutputStream::CompressedOutputStream()
    : CompressedOutputStream(std::make_shared<MemoryOutputStream>()) {}

CompressedOutputStream::~CompressedOutputStream() = default;

void CompressedOutputStream::open() {
  if (outputStream_) outputStream_->open();
}

void CompressedOutputStream::flushPiece(std::size_t produced) {
  if (produced == 0) return;
  if (outputStream_->write(buffer_.data(), produced) != static_cast<long>(produced)) status_ = -1;
}

long CompressedOutputStream::write(const std::uint8_t* buffer, std::size_t length) {
  if (status_ != 0) return -1;
  if (length == 0) return 0;  // nothing to compress; deflate would only report a buffer error
  z_stream& zs = compressor_->zs;
  zs.next_in = const_cast<Bytef*>(buffer);
  zs.avail_in = static_cast<uInt>(length);
  zs.next_out = buffer_.data();
  zs.avail_out = static_cast<uInt>(buffer_.size());
  long written = 0;
  do {
    EVP_DigestUpdate(compressor_->sha, buffer, length);
    status_ = deflate(&zs, Z_NO_FLUSH);
    if (status_ != 0) break;
    written += static_cast<long>(length - zs.avail_in);
    const std::size_t produced = buffer_.size() - zs.avail_out;
    if (produced > 0) {
      flushPiece(produced);
      if (status_ != 0) break;
      zs.next_out = buffer_.data();
      zs.avail_out = static_cast<uInt>(buffer_.size());
    }
  } while (zs.avail_in > 0);
  return written;
}

void CompressedOutputStream::close() {
  if (closed_) return;
  closed_ = true;
  z_stream& zs = compressor_->zs;
  if (compressor_->deflateReady && status_ == 0) {
    zs.next_in = nullptr;
    zs.avail_in = 0;
    while (status_ == 0) {
      zs.next_out = buffer_.data();
      zs.avail_out = static_cast<uInt>(buffer_.size());
      status_ = deflate(&zs, Z_FINISH);
      if (status_ == Z_OK || status_ == Z_STREAM_END) {
        const std::int32_t result = status_;
        status_ = 0;
        flushPiece(buffer_.size() - zs.avail_out);
        if (status_ == 0) status_ = result;
      }
    }
    if (status_ != Z_STREAM_END) status_ = -1;
  } else {
    status_ = -1;
  }
  if (compressor_->sha) {
    unsigned int size = 0;
    EVP_DigestFinal_ex(compressor_->sha, digest_.data(), &size);
  }
  if (compressor_->deflateReady) {
    deflateEnd(&zs);
    compressor_->deflateReady = false;
  }
  if (outputStream_) outputStream_->close();
}

StreamStatus CompressedOutputStream::streamStatus() const {
  switch (status_) {
    case -1: return StreamStatus::Error;
    case 0: return StreamStatus::Open;
    case 1: return StreamStatus::AtEnd;
    default: return StreamStatus::NotOpen;
  }
}

std::optional<std::error_code> CompressedOutputStream::streamError() const {
  if (status_ != -1) return std::nullopt;
  return std::error_code(0, std::generic_category());
}

std::string CompressedOutputStream::dataDigestForStream() const {
  return platform::hexString(std::string_view(reinterpret_cast<const char*>(digest_.data()), digest_.size()));
}

}  // namespace tavix
