#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>

// What the ways to call another process share in the bench `remote`.
namespace Korvel::Bench {

constexpr size_t kBlockSize = 1 << 20;

// The calling end of a connection. False when the answer has not come, or is not what was sent.
class Link {
public:
    virtual ~Link() = default;
    virtual bool Call(double number) = 0;                 // there and back
    virtual bool Block(std::span<const char> block) = 0;  // the same
};

// One way to call another process.
struct Variant {
    const char* m_Name;

    // Listens on a port of the system's choice on the loopback, and returns it; the rest goes on
    // threads of its own until the process ends. Null where there is no other process.
    uint16_t (*m_Serve)();

    // Null when there is no connection. The link is used by the thread that opens it, or with
    // `isShared` by any number at once.
    std::unique_ptr<Link> (*m_Open)(uint16_t port, bool isShared);
};

// The whole size of messages, so that all that is compared moves as many bytes.
struct Sizes {
    uint32_t m_Request;
    uint32_t m_Reply;
};
Sizes GetCallSizes();
Sizes GetBlockSizes();

extern const Variant kKorvel;
extern const Variant kInOneProcess;
extern const Variant kBareSocket;  // a thread that sends and waits; several take turns
extern const Variant kHandOff;     // callers hand to a thread that does so, and sleep
extern const Variant kCapnProto;
extern const Variant kGrpc;

}  // namespace Korvel::Bench
