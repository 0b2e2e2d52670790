// The least that a host does: use an installed library by its public headers.
#include <cstdio>

#include "core/OxID.h"
#include "runtime/lua/RunScript.h"

int main(int argc, char** argv) {
    Korvel::OxID id("consumer");
    printf("%s %u\n", static_cast<const char*>(id + "!"), id.GetHashValue());
    return argc > 1 ? RunScript(argv[1], argv + 2) : 0;
}
