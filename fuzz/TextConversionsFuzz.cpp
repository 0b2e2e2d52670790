// Bytes from outside as text of every encoding: what is converted comes back unchanged, results end
// where they say, and nothing beyond `size` is touched. Every buffer is a heap block of just the
// size told, so that AddressSanitizer sees the rest.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "Platform/Strings.h"
#include "core/OxString.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

// The input as terminated text of U; a NUL in it ends it sooner.
template <class U>
std::vector<U> TextOf(const uint8_t* data, size_t size) {
    std::vector<U> text(size / sizeof(U) + 1);
    if (size >= sizeof(U)) memcpy(text.data(), data, size / sizeof(U) * sizeof(U));
    text.back() = 0;
    return text;
}

template <class U>
int LengthOf(const U* text) {
    int length = 0;
    while (text[length]) length++;
    return length;
}

// Converts into exactly `size` units and looks at what the result says. Null for a failure.
template <class In, class Out>
std::unique_ptr<Out[]> Convert(int (*convert)(const In*, Out*, int), const In* in, int size) {
    std::unique_ptr<Out[]> out(new Out[static_cast<size_t>(size)]);
    memset(out.get(), 0xAA, static_cast<size_t>(size) * sizeof(Out));
    int written = convert(in, out.get(), size);
    Check(written >= 0 && written <= size);
    if (!Platform::IsWholeText(out.get(), written)) return nullptr;
    Check(LengthOf(out.get()) == written - 1);
    return out;
}

// There and back again: what converts fits into the size announced, just fits into its own, and
// returns as it was. `limit` is some size that may be too small.
template <class In, class Out>
void RoundTrip(const In* in, int limit, int (*there)(const In*, Out*, int),
               int (*back)(const Out*, In*, int)) {
    int bound = there(in, nullptr, 0);
    Check(bound > 0);
    Convert(there, in, limit);
    auto out = Convert(there, in, bound);
    if (!out) return;
    int size = LengthOf(out.get()) + 1;
    Check(Convert(there, in, size) != nullptr);
    Check(Convert(there, in, size - 1) == nullptr);
    int length = LengthOf(in);
    auto again = Convert(back, static_cast<const Out*>(out.get()), length + 1);
    Check(again && memcmp(again.get(), in, static_cast<size_t>(length + 1) * sizeof(In)) == 0);
}

void CheckStrings(const char* bytes) {
    int length = LengthOf(bytes);
    OxStringT<char32_t> ucs4(bytes);
    OxStringT<wchar_t> wide(bytes);
    bool isShort = true;
    bool isValid = !ucs4.IsEmpty() || length == 0;
    Check(ucs4.IsEmpty() == wide.IsEmpty());
    Check(!isValid || (ucs4.ToUTF8() == bytes && wide.ToANSI() == bytes));
    // 5 and 6 bytes are beyond what this one knows.
    for (const char* p = bytes; *p; p++) isShort = isShort && static_cast<unsigned char>(*p) < 0xF8;
    Check(!isValid || !isShort || Platform::IsUTF8(bytes));
    Check(!isValid || Platform::utf8strlen(bytes) == ucs4.GetLength());

    OxStringT<char> symbol(bytes);
    symbol.StripName();
    Check(symbol.GetLength() <= length && (isValid || symbol.IsEmpty()));
    OxStringT<char> again(symbol);
    again.StripName();
    Check(again == symbol);

    CharGroups groups(ucs4);
    for (int i = 0; i < groups.m_Count; i++) Check(groups.m_Offsets[i] < groups.m_Offsets[i + 1]);

    OxStringT<char> text(bytes);
    for (int i = 0; i < text.GetLineCount() && i < 50; i++) {
        Check(text.Find(text.GetLine(i)) >= 0 || text.GetLine(i).IsEmpty());
    }
    Check((text.GetWordCount() == 0) == OxStringT<char>(text).Trim().IsEmpty());
    OxStringT<char> half = text.Left(length / 2), rest = text.Mid(length / 2);
    Check(half + rest == text && text.BeginsWith(half) && text.EndsWith(rest));
    int order = stricoll_smart(half, rest);
    int opposite = stricoll_smart(rest, half);
    Check((order < 0) == (opposite > 0) && (order > 0) == (opposite < 0));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    if (size == 0) return 0;
    int limit = data[0] % 32;
    data++;
    size--;
    auto bytes = TextOf<char>(data, size);
    auto codes = TextOf<char32_t>(data, size);
    auto wide = TextOf<wchar_t>(data, size);
    auto units = TextOf<unsigned short>(data, size);
    RoundTrip(bytes.data(), limit, Platform::UTF8ToUCS4, Platform::UCS4ToUTF8);
    RoundTrip(bytes.data(), limit, Platform::UTF8ToUTF16, Platform::UTF16ToUTF8);
    RoundTrip(codes.data(), limit, Platform::UCS4ToUTF8, Platform::UTF8ToUCS4);
    RoundTrip(codes.data(), limit, Platform::UCS4ToWChar, Platform::WCharToUCS4);
    RoundTrip(wide.data(), limit, Platform::WCharToUTF16, Platform::UTF16ToWChar);
    RoundTrip(units.data(), limit, Platform::UTF16ToUTF8, Platform::UTF8ToUTF16);
    RoundTrip(units.data(), limit, Platform::UTF16ToWChar, Platform::WCharToUTF16);
    CheckStrings(bytes.data());
    return 0;
}
