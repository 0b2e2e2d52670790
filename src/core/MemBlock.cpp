#include "core/MemBlock.h"

#include <zlib.h>

#include <bit>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "Platform/FilesInternal.h"

namespace Korvel {
namespace {

constexpr char kMagic[] = {'K', 'L', 'B', 'C'};
constexpr uint32_t kHeaderSize = sizeof(kMagic) + sizeof(uint32_t);

// No zlib stream grows by more; a form that claims it does is a lie that would cost memory.
constexpr uint64_t kMaxGrowth = 1032;
constexpr uint64_t kGrowthSlack = 64;

using Platform::File;

struct Free {
    void operator()(void* p) const { free(p); }
};
using Buffer = std::unique_ptr<Bytef, Free>;

Buffer NewBuffer(size_t size) {
    return Buffer(static_cast<Bytef*>(malloc(size ? size : 1)));
}

bool IsCompressed(const MemBlock& block) {
    return block.m_Size >= sizeof(kMagic) && memcmp(block.m_Ptr, kMagic, sizeof(kMagic)) == 0;
}

uint32_t InLittleEndian(uint32_t number) {
    return std::endian::native == std::endian::little ? number : __builtin_bswap32(number);
}

}  // namespace

MemBlock::MemBlock(const char* filename) {
    File file(Platform::fopen(filename, "rb"));
    int64_t size = file ? Platform::SizeOf(file.get()) : -1;
    if (size <= 0 || size > UINT32_MAX) return;
    Buffer buffer = NewBuffer(static_cast<size_t>(size));
    rewind(file.get());
    if (!buffer || fread(buffer.get(), static_cast<size_t>(size), 1, file.get()) != 1) return;
    m_Ptr = buffer.release();
    m_Size = static_cast<uint32_t>(size);
}

bool MemBlock::Save(const char* filename) const {
    if (!m_Ptr) return false;
    File file(Platform::fopen(filename, "wb"));
    if (!file) return false;
    bool isWritten = fwrite(m_Ptr, 1, m_Size, file.get()) == m_Size;
    // Only the end of the stream tells whether its last bytes found room.
    return fclose(file.release()) == 0 && isWritten;
}

bool MemBlock::Compress() {
    if (!m_Ptr || m_Size < sizeof(kMagic) || IsCompressed(*this)) return false;
    uLongf size = compressBound(m_Size);
    Buffer buffer = NewBuffer(size + kHeaderSize);
    const Bytef* plain = static_cast<const Bytef*>(m_Ptr);
    if (!buffer || compress2(buffer.get() + kHeaderSize, &size, plain, m_Size, 9) != Z_OK ||
        size > UINT32_MAX - kHeaderSize) {
        return false;
    }
    uint32_t plainSize = InLittleEndian(m_Size);
    memcpy(buffer.get(), kMagic, sizeof(kMagic));
    memcpy(buffer.get() + sizeof(kMagic), &plainSize, sizeof(plainSize));
    free(m_Ptr);
    m_Size = static_cast<uint32_t>(size + kHeaderSize);
    m_Ptr = buffer.release();
    // The bound is a little more than the plain size. Where it cannot shrink it stays.
    if (void* shrunk = realloc(m_Ptr, m_Size)) m_Ptr = shrunk;
    return true;
}

bool MemBlock::UnCompress() {
    if (!m_Ptr || m_Size < kHeaderSize || !IsCompressed(*this)) return false;
    const Bytef* form = static_cast<const Bytef*>(m_Ptr);
    uint32_t plainSize;
    memcpy(&plainSize, form + sizeof(kMagic), sizeof(plainSize));
    plainSize = InLittleEndian(plainSize);
    uint32_t streamSize = m_Size - kHeaderSize;
    if (plainSize > kMaxGrowth * streamSize + kGrowthSlack) return false;
    Buffer buffer = NewBuffer(plainSize);
    uLongf size = plainSize;
    if (!buffer || uncompress(buffer.get(), &size, form + kHeaderSize, streamSize) != Z_OK) {
        return false;
    }
    free(m_Ptr);
    m_Ptr = buffer.release();
    m_Size = static_cast<uint32_t>(size);
    return true;
}

}  // namespace Korvel
