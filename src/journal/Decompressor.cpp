// One function for each format that the journal daemon can be built with.

#include "journal/Decompressor.h"

#include <lz4.h>
#include <lzma.h>
#include <zstd.h>

#include <algorithm>

#include "journal/JournalFormat.h"

namespace tessel {

namespace {

// Compressed bytes that are read at once. The tokenizer sees only the first 4 KiB of a value, and
// one read is nearly always enough for these.
constexpr size_t kInputSize = size_t{16} << 10;
// The journal daemon compresses with windows of 1 MiB (XZ) and 2 MiB (ZSTD). The daemon did not
// write a payload that asks for much more, and such a payload would only make us allocate. The log
// of 22 stands for 4 MiB.
constexpr uint64_t kXzMemoryLimit = uint64_t{8} << 20;
constexpr int kZstdLargestWindowLog = 22;

}  // namespace

// Making a context costs more than decompressing a value, so we keep it.
struct Decompressor::ZstdContext {
  ZSTD_DCtx* context = ZSTD_createDCtx();
  ZstdContext() { ZSTD_DCtx_setParameter(context, ZSTD_d_windowLogMax, kZstdLargestWindowLog); }
  ~ZstdContext() { ZSTD_freeDCtx(context); }
  ZstdContext(const ZstdContext&) = delete;
  ZstdContext& operator=(const ZstdContext&) = delete;
};

Decompressor::Decompressor() : input_(kInputSize) {}
Decompressor::~Decompressor() = default;

std::optional<Decompressor::Result> Decompressor::decompress(uint8_t compression,
                                                             const Source& source,
                                                             std::span<uint8_t> target) {
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
  lzma_stream stream = LZMA_STREAM_INIT;
  if (lzma_stream_decoder(&stream, kXzMemoryLimit, 0) != LZMA_OK) return std::nullopt;
  const std::unique_ptr<lzma_stream, void (*)(lzma_stream*)> ending(&stream, lzma_end);
  stream.next_out = target.data();
  stream.avail_out = target.size();
  uint64_t position = 0;
  for (lzma_ret state = LZMA_OK; state != LZMA_STREAM_END && stream.avail_out > 0;) {
    if (stream.avail_in == 0) {
      stream.next_in = input_.data();
      stream.avail_in = source(position, input_);
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
// longer than its text, even if the text compresses badly. So input_ has room for all that the
// first 4 KiB need, and one read is enough.
std::optional<Decompressor::Result> Decompressor::decompressLz4(const Source& source,
                                                                std::span<uint8_t> target) {
  constexpr size_t kSizeBytes = 8;
  const size_t got = source(0, input_);
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
  // Many stores never need the context: other compression, or no long value. So the first use makes
  // it.
  if (!zstd_) zstd_ = std::make_unique<ZstdContext>();
  // The last value was seldom read to its end, so the context still stands in the middle of it.
  ZSTD_DCtx_reset(zstd_->context, ZSTD_reset_session_only);
  ZSTD_outBuffer output{target.data(), target.size(), 0};
  ZSTD_inBuffer input{input_.data(), 0, 0};
  uint64_t position = 0;
  while (output.pos < output.size) {
    if (input.pos == input.size) {
      input.size = source(position, input_);
      input.pos = 0;
      position += input.size;
      if (input.size == 0) return std::nullopt;
    }
    const size_t left = ZSTD_decompressStream(zstd_->context, &output, &input);
    if (ZSTD_isError(left) != 0) return std::nullopt;
    // 0 says that the frame is complete; a payload is one frame.
    if (left == 0) return Result{output.pos, true};
  }
  return Result{output.pos, false};
}

}  // namespace tessel
