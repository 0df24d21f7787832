// Decompressor: the beginning of a compressed payload, by XZ, LZ4 or ZSTD.
//
// Never more is produced than asked for, and the memory that a payload may claim is limited.
//
// Threads: one at a time.

#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <vector>

namespace tessel {

class Decompressor {
 public:
  // Reads from the compressed payload at `position` into `target`; answers how much, 0 at its end.
  using Source = std::function<size_t(uint64_t position, std::span<uint8_t> target)>;

  struct Result {
    size_t produced = 0;
    bool complete = false;  // whether that was all
  };

  Decompressor();
  ~Decompressor();
  Decompressor(const Decompressor&) = delete;
  Decompressor& operator=(const Decompressor&) = delete;

  // Fills `target` with the beginning of the payload. `compression` is one of
  // journal_format::DataFlag. Nothing where the payload is damaged or claims too much.
  std::optional<Result> decompress(uint8_t compression, const Source& source,
                                   std::span<uint8_t> target);

 private:
  struct ZstdContext;

  std::optional<Result> decompressXz(const Source& source, std::span<uint8_t> target);
  std::optional<Result> decompressLz4(const Source& source, std::span<uint8_t> target);
  std::optional<Result> decompressZstd(const Source& source, std::span<uint8_t> target);

  std::vector<uint8_t> input_;
  std::unique_ptr<ZstdContext> zstd_;
};

}  // namespace tessel
