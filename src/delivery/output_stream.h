// Byte output streams for upload bodies: a file sink, a memory sink, a sink that only counts
// (NullStream), and the compressing, digesting CompressedOutputStream that wraps any of them.
//
// A stream belongs to one thread at a time; none of them locks.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <system_error>

#include "platform/files.h"

namespace tavix {

enum class StreamStatus { NotOpen, Opening, Open, Reading, Writing, AtEnd, Closed, Error };

class OutputStream {
 public:
  virtual ~OutputStream() = default;
  virtual void open() = 0;
  // Bytes taken, or -1 on failure.
  virtual long write(const std::uint8_t* buffer, std::size_t length) = 0;
  virtual void close() = 0;
  virtual bool hasSpaceAvailable() const { return true; }
  virtual StreamStatus streamStatus() const = 0;
  virtual std::optional<std::error_code> streamError() const { return std::nullopt; }
};

// Appends to a file that must already exist (the upload's temporary file).
class FileOutputStream final : public OutputStream {
 public:
  explicit FileOutputStream(platform::fs::path path) : path_(std::move(path)) {}
  ~FileOutputStream() override;
  void open() override;
  long write(const std::uint8_t* buffer, std::size_t length) override;
  void close() override;
  StreamStatus streamStatus() const override { return status_; }
  std::optional<std::error_code> streamError() const override;
  const platform::fs::path& path() const { return path_; }

 private:
  platform::fs::path path_;
  int fd_ = -1;
  int errno_ = 0;
  StreamStatus status_ = StreamStatus::NotOpen;
};

class MemoryOutputStream final : public OutputStream {
 public:
  void open() override { status_ = StreamStatus::Open; }
  long write(const std::uint8_t* buffer, std::size_t length) override;
  void close() override { status_ = StreamStatus::Closed; }
  StreamStatus streamStatus() const override { return status_; }
  const std::string& data() const { return data_; }

 private:
  std::string data_;
  StreamStatus status_ = StreamStatus::NotOpen;
};

// Discards everything and counts what it was given; always open, always has space.
class NullStream final : public OutputStream {
 public:
  void open() override {}
  long write(const std::uint8_t*, std::size_t length) override {
    bytesWritten_ += length;
    return static_cast<long>(length);
  }
  void close() override {}
  StreamStatus streamStatus() const override { return StreamStatus::Open; }
  std::uint64_t bytesWritten() const { return bytesWritten_; }

 private:
  std::uint64_t bytesWritten_ = 0;
};

// Raw DEFLATE (no zlib header or trailer) of everything written, passed on to the destination in
// pieces of at most kPieceSize bytes, and a SHA-512 digest for the server to check.
//
// The digest is what the server has always been sent: each pass of write()'s loop hashes the
// whole input buffer again, so an input that fills the output buffer more than once is hashed
// more than once, and write() adds the bytes consumed so far on every pass. The server computes
// the same; do not "fix" either.
class CompressedOutputStream final : public OutputStream {
 public:
  static constexpr std::size_t kPieceSize = 4096;

  // `outputStream` receives the compressed bytes; `outputFile` names it, when it is a file.
  explicit CompressedOutputStream(std::shared_ptr<OutputStream> outputStream,
                                  std::optional<platform::fs::path> outputFile = std::nullopt);
  // Into an in-memory stream (see outputStream()).
  CompressedOutputStream();
  ~CompressedOutputStream() override;
  CompressedOutputStream(const CompressedOutputStream&) = delete;
  CompressedOutputStream& operator=(const CompressedOutputStream&) = delete;

  // Opens the destination.
  void open() override;
  // -1 once finished or failed. A zero-length write returns 0 and changes nothing.
  long write(const std::uint8_t* buffer, std::size_t length) override;
  long write(std::string_view bytes) { return write(reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()); }
  // Finishes the DEFLATE stream, fixes the digest and closes the destination. Once only.
  void close() override;
  bool hasSpaceAvailable() const override { return true; }
  // Open while running, AtEnd once finished, Error after a failure.
  StreamStatus streamStatus() const override;
  // A generic error with value 0 after a failure; none otherwise.
  std::optional<std::error_code> streamError() const override;

  // The digest as 128 lower-case hexadecimal characters; meaningful after close().
  std::string dataDigestForStream() const;
  const std::array<std::uint8_t, 64>& digest() const { return digest_; }

  const std::shared_ptr<OutputStream>& outputStream() const { return outputStream_; }
  const std::optional<platform::fs::path>& outputFile() const { return outputFile_; }
  std::int32_t status() const { return status_; }

 private:
  struct Compressor;
  void flushPiece(std::size_t produced);

  std::shared_ptr<OutputStream> outputStream_;
  std::optional<platform::fs::path> outputFile_;
  std::unique_ptr<Compressor> compressor_;
  std::int32_t status_ = 0;
  bool closed_ = false;
  std::array<std::uint8_t, kPieceSize> buffer_{};
  std::array<std::uint8_t, 64> digest_{};
};

}  // namespace tavix
