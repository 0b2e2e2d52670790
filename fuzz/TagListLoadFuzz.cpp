// Bytes from outside as a tag list: what loads is saved, and loads again as the same.
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "core/TagList.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

std::vector<unsigned char> Save(const TagList& list) {
    int size = 0;
    Check(list.Save(nullptr, size));
    std::vector<unsigned char> form(static_cast<size_t>(size));
    Check(list.Save(form.data(), size) && size == static_cast<int>(form.size()));
    return form;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    // A block of just this size, so that AddressSanitizer sees the rest.
    std::unique_ptr<unsigned char[]> bytes(new unsigned char[size]);
    if (size) memcpy(bytes.get(), data, size);
    TagList list;
    list.Add(TAG_STRING | 1, "old");
    int taken = static_cast<int>(size);
    if (!list.Load(bytes.get(), taken)) {
        Check(list.IsEmpty() && taken == static_cast<int>(size));
        return 0;
    }
    Check(taken >= 8 && taken <= static_cast<int>(size));
    std::vector<unsigned char> form = Save(list);
    Check(static_cast<int>(form.size()) <= taken);

    TagList again, copy;
    taken = static_cast<int>(form.size());
    Check(again.Load(form.data(), taken) && taken == static_cast<int>(form.size()));
    Check(Save(again) == form);
    list.Copy(4);
    Check(Save(list) == form);
    copy.SetTags(&list, true);
    for (const unsigned long long* item = copy.First(); item; item = copy.Next(item)) {
        Check(list.FindQuery(*item));
    }
    list.Clear();
    Check(list.IsEmpty());
    return 0;
}
