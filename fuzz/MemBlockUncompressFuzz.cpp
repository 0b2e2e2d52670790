// Bytes from outside as a compressed block, as they come and behind a right beginning: what does
// not unpack is left as it was, and what does packs and unpacks to the same.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "core/MemBlock.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

std::string BytesOf(const MemBlock& block) {
    return std::string(static_cast<const char*>(block.m_Ptr), block.m_Size);
}

MemBlock NewBlock(const std::string& bytes) {
    // Of just this size, so that AddressSanitizer sees the rest; null only for no bytes at all.
    void* block = malloc(bytes.size());
    if (!bytes.empty()) memcpy(block, bytes.data(), bytes.size());
    return MemBlock(block, static_cast<uint32_t>(bytes.size()));
}

void Try(const std::string& bytes) {
    MemBlock block = NewBlock(bytes);
    if (!block.UnCompress()) {
        Check(BytesOf(block) == bytes);
        free(block.m_Ptr);
        return;
    }
    Check(block.m_Size <= 1032 * (bytes.size() - 8) + 64);
    std::string plain = BytesOf(block);
    if (block.Compress()) {
        Check(BytesOf(block).substr(0, 4) == "KLBC");
        Check(block.UnCompress());
    }
    Check(BytesOf(block) == plain);
    free(block.m_Ptr);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string bytes(reinterpret_cast<const char*>(data), size);
    Try(bytes);
    Try("KLBC" + bytes);
    MemBlock block = NewBlock(bytes);
    if (block.Compress()) {
        Check(block.UnCompress());
        Check(BytesOf(block) == bytes);
    }
    free(block.m_Ptr);
    return 0;
}
