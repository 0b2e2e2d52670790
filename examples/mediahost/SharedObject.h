#pragma once

#include "core/RefObject.h"

// An object that lives as long as anybody holds it: the host by a ptr, or a script by a value, in
// this process or in another one.
class SharedObject : public Korvel::RefObject {
public:
    void IncRef() override { Use(); }
    void DecRef() override { Recycle(); }
};
