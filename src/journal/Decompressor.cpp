// One function for each format that the journal daemon can be built with.

#include "journal/Decompressor.h"

#include <lz4.h>
#include <lzma.h>
#include <zstd.h>

#include <algorithm>

#include "journal/JournalFormat.h"

namespace tessel {

namespace {

// Compressed bytes that are read at once. One read is enough for nearly every value. LZ4 must have
// all that it needs at once: as much as the text, and a little more if that compresses badly.
constexpr size_t kUsualInput = size_t{16} << 10;
constexpr size_t kInputSize = size_t{66} << 10;
// The journal daemon compresses with windows of 1 MiB (XZ) and 2 MiB (ZSTD). Every decoder of ZSTD
// should take windows of 8 MiB, whose log is 23. A payload that asks for more would only make us
// allocate.
constexpr uint64_t kXzMemoryLimit = uint64_t{8} << 20;
constexpr int kZstdLargestWindowLog = 23;

}  // namespace

// Making a context costs more than decompressing a value, so we keep both.
struct Decompressor::Contexts {
  ZSTD_DCtx* zstd = ZSTD_createDCtx();  // null: no memory
  lzma_stream xz = LZMA_STREAM_INIT;
  Contexts() {
    if (zstd != nullptr) ZSTD_DCtx_setParameter(zstd, ZSTD_d_windowLogMax, kZstdLargestWindowLog);
  }
  ~Contexts() {
    ZSTD_freeDCtx(zstd);
    lzma_end(&xz);
  }
  Contexts(const Contexts&) = delete;
  Contexts& operator=(const Contexts&) = delete;
};

Decompressor::Decompressor() : input_(kInputSize) {}
Decompressor::~Decompressor() = default;

std::optional<Decompressor::Result> Decompressor::decompress(uint8_t compression,
                                                             const Source& source,
                                                             std::span<uint8_t> target) {
  // Many stores never need the contexts: other compression, or no long value. So the first use
  // makes them.
  if (!contexts_) contexts_ = std::make_unique<Contexts>();
  switch (compression) {
    case journal_format::kXz:
      return decompressXz(source, target);
    case journal_format::kLz4:
      return decompressLz4(source, target);
    case journal_format::kZstd:
      return decompressZstd(source, target);
    default:
      return std::nullopt;
  }
}

std::optional<Decompressor::Result> Decompressor::decompressXz(const Source& source,
                                                               std::span<uint8_t> target) {
  lzma_stream& stream = contexts_->xz;
  // The last value was seldom read to its end. This begins anew and keeps the memory.
  if (lzma_stream_decoder(&stream, kXzMemoryLimit, 0) != LZMA_OK) return std::nullopt;
  stream.avail_in = 0;
  stream.next_out = target.data();
  stream.avail_out = target.size();
  uint64_t position = 0;
  for (lzma_ret state = LZMA_OK; state != LZMA_STREAM_END && stream.avail_out > 0;) {
    if (stream.avail_in == 0) {
      stream.next_in = input_.data();
      stream.avail_in = source(position, std::span(input_).first(kUsualInput));
      position += stream.avail_in;
      if (stream.avail_in == 0) return std::nullopt;  // cut off: the stream has no end mark
    }
    state = lzma_code(&stream, LZMA_RUN);
    if (state == LZMA_STREAM_END) return Result{target.size() - stream.avail_out, true};
    if (state != LZMA_OK) return std::nullopt;
  }
  return Result{target.size(), false};
}

// The payload begins with the size of the text in eight bytes; one block follows. A block is hardly
// longer than its text, even if the text compresses badly. So one read of input_ holds all that
// `target` needs.
std::optional<Decompressor::Result> Decompressor::decompressLz4(const Source& source,
                                                                std::span<uint8_t> target) {
  constexpr size_t kSizeBytes = 8;
  const size_t needed = target.size() + target.size() / 128 + 64;
  const size_t got = source(0, std::span(input_).first(std::min(needed, input_.size())));
  if (got <= kSizeBytes) return std::nullopt;
  const auto size = journal_format::load<uint64_t>(input_.data());
  const auto wanted = static_cast<int>(std::min<uint64_t>(size, target.size()));
  const int produced = LZ4_decompress_safe_partial(
      reinterpret_cast<const char*>(input_.data()) + kSizeBytes,
      reinterpret_cast<char*>(target.data()), static_cast<int>(got - kSizeBytes), wanted,
      static_cast<int>(target.size()));
  // If the block holds less than the payload states, the rest of `target` still has bytes of
  // another value.
  if (produced < wanted) return std::nullopt;
  return Result{static_cast<size_t>(wanted), size <= target.size()};
}

std::optional<Decompressor::Result> Decompressor::decompressZstd(const Source& source,
                                                                 std::span<uint8_t> target) {
  if (contexts_->zstd == nullptr) return std::nullopt;
  // The last value was seldom read to its end, so the context still stands in the middle of it.
  ZSTD_DCtx_reset(contexts_->zstd, ZSTD_reset_session_only);
  ZSTD_outBuffer output{target.data(), target.size(), 0};
  const std::span<uint8_t> piece = std::span(input_).first(kUsualInput);
  ZSTD_inBuffer input{piece.data(), source(0, piece), 0};
  // The decoder would also take frames that it has to skip, any number of them. The daemon writes
  // none.
  if (input.size < sizeof(uint32_t) ||
      journal_format::load<uint32_t>(piece.data()) != ZSTD_MAGICNUMBER)
    return std::nullopt;
  uint64_t position = input.size;
  while (output.pos < output.size) {
    if (input.pos == input.size) {
      input.size = source(position, piece);
      input.pos = 0;
      position += input.size;
      if (input.size == 0) return std::nullopt;
    }
    const size_t left = ZSTD_decompressStream(contexts_->zstd, &output, &input);
    if (ZSTD_isError(left) != 0) return std::nullopt;
    // 0 says that the frame is complete; a payload is one frame.
    if (left == 0) return Result{output.pos, true};
  }
  return Result{output.pos, false};
}

}  // namespace tessel
