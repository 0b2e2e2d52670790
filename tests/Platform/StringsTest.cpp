#include "Platform/Strings.h"

#include <gtest/gtest.h>

#include <bit>
#include <climits>
#include <cstring>
#include <random>
#include <string>
#include <thread>

namespace Korvel::Platform {
namespace {

// UTF-8 as a table of what each length of sequence may hold.
std::string Encode(uint32_t code) {
    const uint32_t limits[] = {0x80, 0x800, 0x10000, 0x200000, 0x4000000, 0x80000000};
    const int heads[] = {0, 0xC0, 0xE0, 0xF0, 0xF8, 0xFC};
    int trail = 0;
    while (code >= limits[trail]) trail++;
    std::string bytes;
    for (int i = 0; i < trail; i++, code >>= 6) {
        bytes.insert(bytes.begin(), static_cast<char>(0x80 + code % 64));
    }
    bytes.insert(bytes.begin(), static_cast<char>(heads[trail] + static_cast<int>(code)));
    return bytes;
}

// Strict decoding: a sequence is valid if its code point would be written just so.
std::u32string Decode(const std::string& text, bool& isValid) {
    std::u32string codes;
    isValid = true;
    for (size_t i = 0; i < text.size();) {
        unsigned char head = static_cast<unsigned char>(text[i]);
        int length = std::max(std::countl_one(head), 1);
        std::string sequence = text.substr(i, static_cast<size_t>(length));
        uint32_t code = head & (length < 2 ? 0xFFu : 0x7Fu >> length);
        for (size_t k = 1; k < sequence.size(); k++) {
            code = code * 64 + static_cast<unsigned char>(sequence[k]) % 64;
        }
        isValid = length <= 6 && Encode(code) == sequence;
        if (!isValid) break;
        codes += static_cast<char32_t>(code);
        i += sequence.size();
    }
    return codes;
}

// True when both directions and the measures agree with the reference on this text.
bool AgreesOn(const std::string& text) {
    bool isValid;
    std::u32string codes = Decode(text, isValid);
    int count = static_cast<int>(codes.size());
    int size = static_cast<int>(text.size()) + 1;

    char32_t decoded[256];
    wchar_t wide[256];
    bool same = UTF8ToUCS4(text.c_str(), nullptr, 0) == size &&
                UTF8ToUCS4(text.c_str(), decoded, 256) == count + isValid &&
                UTF8ToWChar(text.c_str(), wide, 256) == count + isValid &&
                memcmp(decoded, codes.data(), codes.size() * 4) == 0 &&
                memcmp(wide, codes.data(), codes.size() * 4) == 0 &&
                (count + isValid == 0 || IsWholeText(decoded, count + isValid) == isValid);
    if (!isValid || !same) return same;

    char encoded[256];
    return utf8strlen(text.c_str()) == count && UCS4ToUTF8(decoded, nullptr, 0) == 6 * count + 1 &&
           UCS4ToUTF8(decoded, encoded, size) == size && text == encoded &&
           UCS4ToUTF8(decoded, encoded, size - 1) + UCS4ToUTF8(decoded, encoded, size / 2) == 0 &&
           UTF8ToUCS4(text.c_str(), decoded, count) +
                   UTF8ToUCS4(text.c_str(), decoded, count / 2) ==
               0;
}

TEST(Conversions, AgreeWithTheReferenceOnAllShortTexts) {
    char text[4] = {};
    for (int i = 0; i < 1 << 24; i++) {
        for (int k = 0; k < 3; k++) text[k] = static_cast<char>(i >> 8 * k);
        if (!AgreesOn(text)) FAIL() << std::hex << i;
    }
}

// Sequences of all lengths around their limits, between runs of ASCII, many of them damaged.
TEST(Conversions, AgreeWithTheReferenceOnLongTexts) {
    std::mt19937 random(3);
    auto below = [&](uint32_t limit) { return static_cast<uint32_t>(random() % limit); };
    const uint32_t edges[] = {0x80,      0x800,      0x10000, 0x200000,
                              0x4000000, 0x7FFFFFFF, 0xD800,  0x110000};
    for (int i = 0; i < 200000; i++) {
        std::string text;
        for (uint32_t parts = below(6); parts > 0; parts--) {
            text.append(below(20), static_cast<char>('a' + below(26)));
            uint32_t code = below(2) ? edges[below(8)] - below(2) : below(0x7FFFFFFF) >> below(24);
            text += Encode(std::max(code, 1u));
        }
        if (!text.empty() && below(2))
            text[below(static_cast<uint32_t>(text.size()))] = static_cast<char>(1 + below(255));
        if (below(4) == 0) text.resize(below(static_cast<uint32_t>(text.size()) + 1));
        ASSERT_TRUE(AgreesOn(text)) << testing::PrintToString(text);
    }
}

TEST(Conversions, RefuseWhatHasNoForm) {
    char bytes[32];
    char32_t codes[32];
    const unsigned short noUnits[] = {0};
    const char32_t tooLarge[] = {'a', 0x80000000, 0};
    EXPECT_EQ(UCS4ToUTF8(tooLarge, bytes, 32), 0);
    EXPECT_EQ(UTF8ToUCS4("a\xC0\x80", codes, 32), 1);
    for (int size : {0, -1, INT_MIN}) {
        EXPECT_EQ(UTF8ToUCS4("", codes, size) + UCS4ToUTF8(U"", bytes, size), 0);
        EXPECT_EQ(UTF16ToUTF8(noUnits, bytes, size) + WCharToUCS4(L"", codes, size), 0);
    }
    EXPECT_EQ(UTF8ToUCS4(nullptr, codes, 32) + UCS4ToUTF8(nullptr, nullptr, 0), 0);
    EXPECT_EQ(WCharToUCS4(nullptr, codes, 32) + UTF16ToUTF8(nullptr, bytes, 32), 0);
    EXPECT_EQ(WCharToUCS4(L"abc", codes, 3), 0);
    EXPECT_EQ(WCharToUCS4(L"abc", nullptr, 0), 4);
    EXPECT_EQ(WCharToUCS4(L"abc", codes, 4), 4);
    EXPECT_EQ(codes[3], U'\0');
}

void ConvertUTF16() {
    const unsigned short text[] = {'a', 0x20AC, 0xD83D, 0xDE00, 0};
    const unsigned short unpaired[] = {'a', 0xDE00, 'b', 0};
    char bytes[32];
    wchar_t wide[32];
    unsigned short units[32];
    EXPECT_EQ(UTF16ToUTF8(text, bytes, 9), 9);
    EXPECT_STREQ(bytes, "a€😀");
    EXPECT_EQ(UTF16ToUTF8(text, bytes, 8), 0);
    // A failure leaves nothing behind that the next conversion would trip over.
    EXPECT_EQ(UTF16ToUTF8(unpaired, bytes, 32), 0);
    EXPECT_EQ(UTF16ToUTF8(text, bytes, 32), 9);
    EXPECT_EQ(UTF16ToWChar(unpaired, wide, 32), 0);
    EXPECT_EQ(UTF16ToWChar(text, wide, 32), 4);
    EXPECT_STREQ(wide, L"a€😀");
    EXPECT_EQ(WCharToUTF16(wide, units, 32), 5);
    EXPECT_EQ(memcmp(units, text, sizeof(text)), 0);
    EXPECT_EQ(UTF8ToUTF16("a€😀", units, 32), 5);
    EXPECT_EQ(memcmp(units, text, sizeof(text)), 0);
    const wchar_t tooLarge[] = {0x110000, 0};
    EXPECT_EQ(UTF8ToUTF16("a\xC0\x80", units, 32) + WCharToUTF16(tooLarge, units, 32), 0);
    // The sizes that are sure to suffice.
    EXPECT_TRUE(UTF16ToUTF8(text, nullptr, 0) >= 9 && UTF8ToUTF16("a€😀", nullptr, 0) >= 5);
    EXPECT_TRUE(WCharToUTF16(wide, nullptr, 0) >= 5 && UTF16ToWChar(text, nullptr, 0) >= 4);
}

TEST(Conversions, UTF16InEveryThread) {
    std::thread other(ConvertUTF16);
    ConvertUTF16();
    other.join();
}

TEST(Text, IsUTF8LooksAtTheShapeAlone) {
    for (const char* good : {"", "abc", "\xC0\x80", "\xE0\x80\x80", "\xF7\xBF\xBF\xBF", "ß€😀"})
        EXPECT_TRUE(IsUTF8(good)) << good;
    for (const char* bad : {"\x80", "a\xC3", "\xE2\x82", "\xE2\x82z", "\xF8\x88\x80\x80",
                            "\xE2\xC3\x82", "\xFF", "ß\xBF"})
        EXPECT_FALSE(IsUTF8(bad)) << bad;
    EXPECT_TRUE(IsUTF8(nullptr));
    EXPECT_EQ(utf8strlen("ß€😀"), 3);
    EXPECT_EQ(utf8strlen(nullptr), 0);
}

template <class T>
int Measure(int (*measure)(const T*, va_list), const T* format, ...) {
    va_list args;
    va_start(args, format);
    int length = measure(format, args);
    EXPECT_EQ(measure(format, args), length);  // the arguments can be read once more
    va_end(args);
    return length;
}

TEST(Text, MeasuresFormattedText) {
    EXPECT_EQ(Measure(_vscprintf, "%d-%s", 12, "abc"), 6);
    EXPECT_EQ(Measure(_vscprintf, "%*d", 100000, 1), 100000);
    EXPECT_EQ(Measure<char>(_vscprintf, nullptr), -1);
    for (int length : {0, 511, 512, 513, 32767, 32768})
        EXPECT_EQ(Measure(_vscwprintf, L"%.*d", length, 0), length);
    EXPECT_EQ(Measure(_vscwprintf, L"%*d", 32769, 1), -1);
    EXPECT_EQ(Measure<wchar_t>(_vscwprintf, nullptr), -1);
}

}  // namespace
}  // namespace Korvel::Platform
