#include "core/OxID.h"

#include <climits>
#include <cstdio>
#include <cstring>

#include "Platform/Strings.h"
#include "core/TextCellInternal.h"

namespace Korvel {
namespace {

bool IsLetter(char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
}
bool IsDigit(char c) {
    return c >= '0' && c <= '9';
}

const char* OrEmpty(const char* text) {
    return text ? text : "";
}

// What a foreign text holds inside may come to stand at the head of a new one.
char* Finish(char* cell) {
    cell[1] = TextCell::SafeFirstByte(cell[1]);
    return cell;
}

// A cell with the first `aLength` bytes of `a`, then the first `bLength` of `b`.
char* NewCell(const char* a, size_t aLength, const char* b = "", size_t bLength = 0) {
    char* cell = TextCell::New(aLength + bLength);
    if (!cell) return nullptr;
    memcpy(cell + 1, a, aLength);
    memcpy(cell + 1 + aLength, b, bLength);
    return Finish(cell);
}

// A cell with the whole of one text, or of two; null texts are left out, all null gives null.
char* NewCell(const char* a, const char* b = nullptr) {
    if (!a && !b) return nullptr;
    a = OrEmpty(a);
    b = OrEmpty(b);
    return NewCell(a, strlen(a), b, strlen(b));
}

using CompareBytes = int (*)(const char*, const char*, size_t);

bool BeginsWith(const char* whole, const char* part, CompareBytes compare) {
    part = TextCell::Text(part);
    return !part || compare(OrEmpty(whole), part, strlen(part)) == 0;
}

bool EndsWith(const char* whole, const char* part, CompareBytes compare) {
    part = TextCell::Text(part);
    if (!part) return true;
    whole = OrEmpty(whole);
    size_t wholeLength = strlen(whole);
    size_t length = strlen(part);
    return length <= wholeLength && compare(whole + wholeLength - length, part, length) == 0;
}

uint32_t HashStep(uint32_t hash, size_t index, char c) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c + 32);
    uint32_t mix = index % 2 == 0 ? (hash >> 3) ^ (hash << 7) : ~((hash >> 5) ^ (hash << 11));
    // The byte is taken as signed, whatever `char` is: keys must hash alike on every machine.
    return hash ^ mix ^ static_cast<uint32_t>(static_cast<int32_t>(static_cast<signed char>(c)));
}

}  // namespace

const OxID NOID;

uint32_t GetHashValue(const char* text, TagList*) {
    uint32_t hash = 0;
    if (!text) return hash;
    for (size_t i = 0; text[i]; i++) hash = HashStep(hash, i, text[i]);
    return hash;
}

uint32_t GetHashValue(const char* text, int length, TagList*) {
    uint32_t hash = 0;
    if (!text) return hash;
    for (int i = 0; i < length; i++) hash = HashStep(hash, static_cast<size_t>(i), text[i]);
    return hash;
}

OxID::OxID(const OxID& other) : m_Text(TextCell::Use(other.m_Text)) {}
OxID::OxID(const char* text, bool copy) {
    Set(text, copy);
}
OxID::OxID(const char* a, const char* b) {
    Set(a, b);
}
OxID::OxID(const char* text, unsigned long length) {
    Set(text, length);
}
OxID::~OxID() {
    TextCell::Drop(m_Text);
}

OxID OxID::FromCell(const char* cell) {
    OxID id;
    id.m_Text = cell;
    return id;
}

// The old text goes last: the new one may have been read out of it.
void OxID::Take(const char* cell) {
    const char* old = m_Text;
    m_Text = cell;
    TextCell::Drop(old);
}

OxID& OxID::operator=(const OxID& other) {
    Set(other);
    return *this;
}

OxID& OxID::operator=(OxID&& other) noexcept {
    const char* text = other.m_Text;
    other.m_Text = nullptr;
    Take(text);
    return *this;
}

void OxID::Set(const OxID& other) {
    Take(TextCell::Use(other.m_Text));
}

// True for a text inside of our own cell, which goes when another text takes its place.
bool OxID::Owns(const char* text) const {
    return TextCell::IsCell(m_Text) && text > m_Text && text <= m_Text + 1 + GetLength();
}

void OxID::Set(const char* text, bool copy) {
    bool isPlain = text && !TextCell::IsCell(text);
    Take(isPlain && (copy || Owns(text)) ? NewCell(text) : TextCell::Use(text));
}

void OxID::Set(const char* a, const char* b) {
    Take(NewCell(TextCell::Text(a), TextCell::Text(b)));
}

void OxID::Set(const char* text, unsigned long length) {
    text = TextCell::Text(text);
    Take(text ? NewCell(text, strnlen(text, length)) : nullptr);
}

OxID::operator const char*() const {
    return TextCell::Text(m_Text);
}

OxID& OxID::operator+=(const char* text) {
    Set(*this, text);
    return *this;
}

OxID& OxID::operator+=(char c) {
    const char* text = OrEmpty(*this);
    Take(NewCell(text, strlen(text), &c, c ? 1 : 0));
    return *this;
}

OxID OxID::operator+(const char* text) const {
    return OxID(*this, text);
}
OxID operator+(const char* text, const OxID& id) {
    return OxID(text, static_cast<const char*>(id));
}

bool OxID::operator==(const char* text) const {
    const char* own = *this;
    text = TextCell::Text(text);
    return own == text || strcmp(OrEmpty(own), OrEmpty(text)) == 0;
}

bool OxID::IsValid() const {
    return !IsNull(this) && m_Text;
}
bool OxID::IsEmpty() const {
    return IsNull(this) || !*OrEmpty(*this);
}
int OxID::GetLength() const {
    return IsNull(this) ? 0 : static_cast<int>(strlen(OrEmpty(*this)));
}
uint32_t OxID::GetHashValue() const {
    return IsNull(this) ? 0 : Korvel::GetHashValue(*this);
}

int OxID::Find(char c, int start) const {
    if (start < 0 || start >= GetLength()) return -1;
    const char* text = *this;
    const char* found = c ? strchr(text + start, c) : nullptr;
    return found ? static_cast<int>(found - text) : -1;
}

int OxID::ReverseFind(char c, int start) const {
    int length = GetLength();
    if (start == -1) start = length - 1;
    if (start < 0 || start >= length) return -1;
    const char* text = *this;
    while (start >= 0 && text[start] != c) start--;
    return start;
}

OxID OxID::Mid(int start, int n) const {
    int length = GetLength();
    if (start < 0) start = 0;
    if (start >= length) return OxID();
    if (n < 0 || n > length - start) n = length - start;
    if (n == length) return *this;
    return FromCell(NewCell(TextCell::Text(m_Text) + start, static_cast<size_t>(n)));
}

OxID OxID::Left(int n) const {
    return Mid(0, n);
}

bool OxID::BeginsWith(const char* text) const {
    return Korvel::BeginsWith(*this, text, strncmp);
}
bool OxID::BeginsWithNoCase(const char* text) const {
    return Korvel::BeginsWith(*this, text, strncasecmp);
}
bool OxID::EndsWith(const char* text) const {
    return Korvel::EndsWith(*this, text, strncmp);
}
bool OxID::EndsWithNoCase(const char* text) const {
    return Korvel::EndsWith(*this, text, strncasecmp);
}

bool OxID::IsInGroup() const {
    return Find('.') >= 0;
}

bool OxID::IsInGroup(const char* group) const {
    group = TextCell::Text(group);
    if (!group || !BeginsWith(group)) return false;
    size_t length = strlen(group);
    char next = OrEmpty(*this)[length];
    return next == '.' || next == '\0' || (length && group[length - 1] == '.');
}

bool OxID::IsSameGroup(const char* other) const {
    const char* a = OrEmpty(*this);
    const char* b = OrEmpty(TextCell::Text(other));
    const char* aDot = strrchr(a, '.');
    const char* bDot = strrchr(b, '.');
    if (!aDot || !bDot) return aDot == bDot;
    return aDot - a == bDot - b && memcmp(a, b, static_cast<size_t>(aDot - a)) == 0;
}

bool OxID::IsValidSymbol() const {
    const char* text = OrEmpty(*this);
    auto isHead = [](char c) { return IsLetter(c) || c == '_'; };
    if (!isHead(*text)) return false;
    while (*++text) {
        if (*text == '.' && isHead(text[1])) continue;
        if (!isHead(*text) && !IsDigit(*text)) return false;
    }
    return true;
}

void OxID::SetFormatted(const char* head, const char* format, va_list args) {
    if (!format) {
        Take(nullptr);
        return;
    }
    va_list again;
    va_copy(again, args);
    int length = Platform::_vscprintf(format, args);
    size_t headLength = strlen(OrEmpty(head));
    char* cell = length < 0 ? nullptr : TextCell::New(headLength + static_cast<size_t>(length));
    if (cell) {
        memcpy(cell + 1, OrEmpty(head), headLength);
        vsnprintf(cell + 1 + headLength, static_cast<size_t>(length) + 1, format, again);
        Finish(cell);
    }
    va_end(again);
    Take(cell);
}

void OxID::PrintF(const char* format, ...) {
    va_list args;
    va_start(args, format);
    SetFormatted(nullptr, format, args);
    va_end(args);
}

void OxID::CatF(const char* format, ...) {
    va_list args;
    va_start(args, format);
    SetFormatted(*this, format, args);
    va_end(args);
}

}  // namespace Korvel
