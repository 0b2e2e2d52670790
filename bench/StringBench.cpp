// OxStringT beside std::string, and the conversions of UTF-8 beside iconv.
#include <iconv.h>

#include <functional>
#include <string>

#include "Compare.h"
#include "Platform/Strings.h"
#include "core/OxString.h"

namespace {

using Korvel::OxStringT;

// `length` bytes of English-like text, or of text in which every fourth character is two bytes.
std::string MakeText(size_t length, bool isAscii) {
    std::string text;
    for (size_t i = 0; text.size() < length; i++) {
        if (!isAscii && i % 4 == 3) {
            text += "ß";
        } else {
            text += static_cast<char>('a' + i % 26);
        }
    }
    return text;
}

template <class String>
void Copy(benchmark::State& state) {
    const String original(MakeText(static_cast<size_t>(state.range(0)), true).c_str());
    for (auto _ : state) {
        String copy(original);
        benchmark::DoNotOptimize(copy);
    }
}

template <class String>
void Make(benchmark::State& state) {
    const std::string text = MakeText(static_cast<size_t>(state.range(0)), true);
    for (auto _ : state) {
        String made(text.c_str());
        benchmark::DoNotOptimize(made);
    }
}

// A text of this length put together from words of eight letters.
template <class String>
void Append(benchmark::State& state) {
    for (auto _ : state) {
        String text;
        for (int64_t i = 0; i < state.range(0); i += 8) text += "eightlet";
        benchmark::DoNotOptimize(text);
    }
}

template <class String>
void Join(benchmark::State& state) {
    const String half(MakeText(static_cast<size_t>(state.range(0)) / 2, true).c_str());
    for (auto _ : state) {
        String whole = half + half;
        benchmark::DoNotOptimize(whole);
    }
}

// Two equal texts that do not share a buffer.
template <class String>
void Equal(benchmark::State& state) {
    const std::string text = MakeText(static_cast<size_t>(state.range(0)), true);
    String a(text.c_str()), b(text.c_str());
    for (auto _ : state) {
        benchmark::DoNotOptimize(a);
        bool equal = a == b;
        benchmark::DoNotOptimize(equal);
    }
}

int Order(const OxStringT<char>& a, const OxStringT<char>& b) {
    return a.Compare(b);
}
int Order(const std::string& a, const std::string& b) {
    return a.compare(b);
}

template <class String>
void Compare(benchmark::State& state) {
    const std::string text = MakeText(static_cast<size_t>(state.range(0)), true);
    String a((text + "a").c_str()), b((text + "b").c_str());
    for (auto _ : state) {
        benchmark::DoNotOptimize(a);
        int order = Order(a, b);
        benchmark::DoNotOptimize(order);
    }
}

void OwnDecode(const std::string& text, std::u32string& out) {
    Korvel::Platform::UTF8ToUCS4(text.c_str(), out.data(), static_cast<int>(out.size()));
}

void OwnEncode(const std::u32string& text, std::string& out) {
    Korvel::Platform::UCS4ToUTF8(text.c_str(), out.data(), static_cast<int>(out.size()));
}

template <class In, class Out>
void ByIconv(iconv_t handle, const In& text, Out& out) {
    char* from = reinterpret_cast<char*>(const_cast<typename In::value_type*>(text.c_str()));
    size_t fromBytes = (text.size() + 1) * sizeof(text[0]);
    char* to = reinterpret_cast<char*>(out.data());
    size_t toBytes = out.size() * sizeof(out[0]);
    iconv(handle, &from, &fromBytes, &to, &toBytes);
}

// What both sides write into is there before, and so is the descriptor of iconv.
void Decode(benchmark::State& state, bool isAscii, bool isOwn) {
    const std::string text = MakeText(static_cast<size_t>(state.range(0)), isAscii);
    std::u32string out(text.size() + 1, U'\0');
    iconv_t handle = iconv_open("utf-32le", "utf-8");
    for (auto _ : state) {
        if (isOwn) {
            OwnDecode(text, out);
        } else {
            ByIconv(handle, text, out);
        }
        benchmark::DoNotOptimize(out.data());
        benchmark::ClobberMemory();
    }
    iconv_close(handle);
}

void Encode(benchmark::State& state, bool isAscii, bool isOwn) {
    const OxStringT<char32_t> wide(MakeText(static_cast<size_t>(state.range(0)), isAscii).c_str());
    const std::u32string text(static_cast<const char32_t*>(wide));
    std::string out(text.size() * 6 + 1, '\0');
    iconv_t handle = iconv_open("utf-8", "utf-32le");
    for (auto _ : state) {
        if (isOwn) {
            OwnEncode(text, out);
        } else {
            ByIconv(handle, text, out);
        }
        benchmark::DoNotOptimize(out.data());
        benchmark::ClobberMemory();
    }
    iconv_close(handle);
}

void Add(const std::string& row, const char* variant, std::function<void(benchmark::State&)> body) {
    benchmark::RegisterBenchmark((row + "@" + variant).c_str(), std::move(body))
        ->RangeMultiplier(8)
        ->Range(8, 4096);
}

}  // namespace

int main(int argc, char** argv) {
    using Own = OxStringT<char>;
    auto addPair = [](const char* row, auto own, auto peer) {
        Add(row, "OxStringT", own);
        Add(row, "std::string", peer);
    };
    addPair("copy", Copy<Own>, Copy<std::string>);
    addPair("make", Make<Own>, Make<std::string>);
    addPair("append8", Append<Own>, Append<std::string>);
    addPair("join", Join<Own>, Join<std::string>);
    addPair("equal", Equal<Own>, Equal<std::string>);
    addPair("compare", Compare<Own>, Compare<std::string>);
    for (bool isAscii : {true, false}) {
        for (bool isOwn : {true, false}) {
            const std::string kind = isAscii ? " ascii" : " mixed";
            const char* variant = isOwn ? "OxStringT" : "iconv";
            Add("utf-8 to ucs-4" + kind, variant,
                [=](benchmark::State& state) { Decode(state, isAscii, isOwn); });
            Add("ucs-4 to utf-8" + kind, variant,
                [=](benchmark::State& state) { Encode(state, isAscii, isOwn); });
        }
    }
    return Korvel::Bench::RunComparison(argc, argv);
}
