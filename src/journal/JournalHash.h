// The two hashes of the journal file format.
//
// Every data object has the hash of its FIELD=value: SipHash-2-4 with the id of the file as the
// key if the file has the flag kKeyedHash, otherwise Jenkins' lookup3. Every entry has the
// exclusive or of the lookup3 hashes of its values, whatever the flag says, so that copies of an
// entry in two files have equal hashes. Both tell us whether bytes are what the daemon wrote.
//
// Pure functions.

#pragma once

#include <cstddef>
#include <cstdint>
#include <span>

#include "journal/EntryStream.h"

namespace tessel {

uint64_t lookup3(std::span<const uint8_t> bytes);
uint64_t sipHash24(std::span<const uint8_t> bytes, const Id128& key);

}  // namespace tessel
