#include "core/MemBlock.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <set>
#include <string>

#include "Platform/Files.h"
#include "Platform/Processes.h"
#include "Support.h"
#include "core/FaultsInternal.h"

namespace Korvel {
namespace {

// A block on the heap until the end of its scope.
struct Block : MemBlock {
    explicit Block(const std::string& bytes)
        : MemBlock(malloc(bytes.size() + 1), static_cast<uint32_t>(bytes.size())) {
        memcpy(m_Ptr, bytes.data(), bytes.size());
    }
    explicit Block(const char* path) : MemBlock(path) {}
    Block(const Block&) = delete;
    Block& operator=(const Block&) = delete;
    ~Block() { free(m_Ptr); }

    std::string Bytes() const { return {static_cast<const char*>(m_Ptr), m_Size}; }
};

TEST(MemBlock, ReadsAndWritesFiles) {
    Korvel::Test::TempDir dir;
    std::string path = dir.Path("file"), bytes("a\0\xFF", 3);
    bytes.resize(100000, 'x');
    Block block(bytes);
    EXPECT_TRUE(block.Save(path.c_str()));
    EXPECT_EQ(Block(path.c_str()).Bytes(), bytes);
    EXPECT_FALSE(block.Save(dir.Path("none/file").c_str()) || MemBlock().Save(path.c_str()));
    EXPECT_FALSE(block.Save("/dev/full"));

    std::string tooLarge = dir.Write("large", "");
    ASSERT_EQ(truncate(tooLarge.c_str(), 0x100000000), 0);  // sparse
    for (const std::string& other :
         {dir.Write("empty", ""), dir.Path("none"), dir.Path(""), tooLarge}) {
        MemBlock nothing(other.c_str());
        EXPECT_TRUE(!nothing.m_Ptr && nothing.m_Size == 0) << other;
    }
    EXPECT_EQ(MemBlock(static_cast<const char*>(nullptr)).m_Ptr, nullptr);
}

TEST(MemBlock, CompressesAndBack) {
    std::string noise;
    for (unsigned i = 1; noise.size() < 5000; i = i * 1103515245 + 12345) {
        noise += static_cast<char>(i >> 24);
    }
    for (const std::string& bytes : {std::string("abcd"), std::string(1 << 20, 'a'), noise}) {
        Block block(bytes);
        ASSERT_TRUE(block.Compress());
        std::string form = block.Bytes();
        uint32_t size;
        memcpy(&size, form.data() + 4, sizeof(size));
        EXPECT_TRUE(form.substr(0, 4) == "KLBC" && size == bytes.size());
        EXPECT_FALSE(block.Compress());
        EXPECT_EQ(block.Bytes(), form);
        EXPECT_TRUE(block.UnCompress());
        EXPECT_EQ(block.Bytes(), bytes);
        EXPECT_FALSE(block.UnCompress());
    }
}

TEST(MemBlock, RefusesWhatIsNoFormOfABlock) {
    Block good(std::string("some bytes, some bytes"));
    ASSERT_TRUE(good.Compress());
    const std::string form = good.Bytes();
    auto withSize = [&](uint32_t size) {
        std::string changed = form;
        memcpy(&changed[4], &size, sizeof(size));
        return changed;
    };
    const uint32_t most = static_cast<uint32_t>(1032 * (form.size() - 8) + 64);
    const std::string cases[] = {"",
                                 "KLB",
                                 "KLBC",
                                 form.substr(0, 7),
                                 form.substr(0, 8),
                                 form.substr(0, form.size() - 1),
                                 withSize(21),
                                 withSize(0xFFFFFFFF),
                                 withSize(most + 1),
                                 "XLBC" + form.substr(4)};
    for (const std::string& bytes : cases) {
        Block block(bytes);
        EXPECT_FALSE(block.UnCompress());
        EXPECT_EQ(block.Bytes(), bytes);
        EXPECT_FALSE(bytes.size() < 5 && block.Compress());
    }
    // A size that is larger than it had to be is corrected.
    Block block(withSize(most));
    EXPECT_TRUE(block.UnCompress());
    EXPECT_EQ(block.Bytes(), "some bytes, some bytes");
    EXPECT_FALSE(MemBlock().Compress() || MemBlock().UnCompress());
}

#ifdef KORVEL_FAULTS
TEST(MemBlock, StaysAsItWasWithoutMemory) {
    Korvel::Test::TempDir dir;
    std::string path = dir.Write("file", "content");
    for (unsigned n = 1; n < 4; n++) {
        Block block(std::string("some bytes"));
        Faults::FailAt(n, true);
        bool isCompressed = block.Compress();
        Block read(path.c_str());
        char* uuid = Platform::NewUUID();
        Faults::Stop();
        EXPECT_TRUE(!read.m_Ptr && !uuid);
        EXPECT_TRUE(!isCompressed || block.UnCompress());
        EXPECT_EQ(block.Bytes(), "some bytes");
    }
}
#endif

TEST(Files, CloseWhenAProgramIsExecuted) {
    Korvel::Test::TempDir dir;
    std::string path = dir.Path("file");
    EXPECT_FALSE(Platform::fopen(nullptr, "r") || Platform::fopen(path.c_str(), nullptr) ||
                 Platform::fopen(path.c_str(), "") || Platform::fopen(path.c_str(), "r"));
    EXPECT_FALSE(Platform::fdopen(-1, "r") || Platform::fdopen(0, nullptr));
    auto closes = [](FILE* file) {
        bool isClosing = file && fcntl(fileno(file), F_GETFD) == FD_CLOEXEC;
        if (file) fclose(file);
        return isClosing;
    };
    for (const char* mode : {"w+b", "r+", "a"}) {
        EXPECT_TRUE(closes(Platform::fopen(path.c_str(), mode))) << mode;
    }
    EXPECT_TRUE(closes(Platform::fdopen(open(path.c_str(), O_RDONLY), "r")));
}

TEST(Processes, UUIDsAreRandomAndWellFormed) {
    std::set<std::string> seen;
    for (int i = 0; i < 100; i++) {
        char* uuid = Platform::NewUUID();
        std::string text = uuid;
        Platform::DeleteUUID(uuid);
        ASSERT_EQ(text.size(), 36u);
        for (size_t k = 0; k < 36; k++) {
            bool isDash = k == 8 || k == 13 || k == 18 || k == 23;
            EXPECT_NE(strchr(isDash ? "-" : "0123456789abcdef", text[k]), nullptr) << text;
        }
        EXPECT_TRUE(text[14] == '4' && strchr("89ab", text[19]));
        seen.insert(text);
    }
    EXPECT_EQ(seen.size(), 100u);
    Platform::DeleteUUID(nullptr);
}

}  // namespace
}  // namespace Korvel
