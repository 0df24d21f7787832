// Decompressor: the beginning of a payload that was compressed with XZ, LZ4 or ZSTD.
//
// It never produces more than the caller asks for, so a small payload that claims to be gigabytes
// costs nothing. It also bounds the memory that the libraries allocate for a payload.
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
  // Reads the compressed bytes from `position` on into `target`; returns how many, 0 at the end.
  using Source = std::function<size_t(uint64_t position, std::span<uint8_t> target)>;

  struct Result {
    size_t produced = 0;
    bool complete = false;  // whether `produced` is the whole payload
  };

  Decompressor();
  ~Decompressor();
  Decompressor(const Decompressor&) = delete;
  Decompressor& operator=(const Decompressor&) = delete;

  // Fills `target` with the beginning of the decompressed payload. `compression` is one
  // journal_format::DataFlag. Returns nothing if the payload is damaged or needs too much memory.
  std::optional<Result> decompress(uint8_t compression, const Source& source,
                                   std::span<uint8_t> target);

 private:
  struct Contexts;

  std::optional<Result> decompressXz(const Source& source, std::span<uint8_t> target);
  std::optional<Result> decompressLz4(const Source& source, std::span<uint8_t> target);
  std::optional<Result> decompressZstd(const Source& source, std::span<uint8_t> target);

  std::vector<uint8_t> input_;
  std::unique_ptr<Contexts> contexts_;
};

}  // namespace tessel
