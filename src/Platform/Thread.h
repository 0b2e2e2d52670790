#pragma once

#include "core/Export.h"
#include "core/RefObject.h"

namespace Korvel::Platform {
struct _Thread;
}

namespace Korvel::KorvelScript {

// A thread as an object: a subclass brings the body, Main. When the body has ended it can be
// started again.
//
// Lifetime: the destructor waits up to 10 seconds for the end of the body and then kills it. A body
//           that has not begun by then never does. By that time the subclass is gone: where the
//           body uses its fields, its destructor ends the body by its own protocol and waits. With
//           DeleteOnQuit the object goes on its own thread when the body ends. The body itself may
//           destroy the object, if it does not touch it afterwards.
// Threads:  any, as long as the object lives; it is for whoever destroys it to know that nobody
//           uses it. That goes for objects with DeleteOnQuit from Start on.
// Failure:  without memory no thread starts.
class KORVEL_EXPORT Thread : public RefObject {
public:
    Thread();
    Thread(const Thread&) = delete;
    Thread& operator=(const Thread&) = delete;
    ~Thread() override = 0;

    unsigned int SizeOf() override { return sizeof(Thread); }

    // Starts the body. Returns the handle as GetThread does; null when it does not start, or when
    // one runs already.
    Platform::_Thread* Start();

    void Stop() {}  // a subclass stops its body by its own protocol

    // As ResumeThread and SuspendThread, which have no effect on a thread that runs. Always true.
    bool Suspend();
    bool Resume();

    bool IsRunning() const;  // from Start to the end of the body

    // Borrowed from the object; null when not started and when the body has ended, which takes the
    // handle with it. WaitThread on it is safe when it begins before that.
    Platform::_Thread* GetThread() const;

    // Ends the body at once, see Platform::KillThread. The object is not destroyed by that, not
    // even with DeleteOnQuit. False when nothing runs or the thread could not be killed. From the
    // thread itself it does not return.
    bool KillThread();

    // Whether the object is destroyed when Main returns.
    void SetDeleteOnQuit(bool deleteOnQuit);

    // The body. Every subclass has one of its own. This one is there for the moment in which a
    // thread begins while its object is being destroyed and all but this class is gone.
    virtual int Main() { return 0; }

private:
    struct Record;

    static unsigned long long threadFunc(void* argument);
    static unsigned long long RunMain(Thread* self);

    Record* m_Record;
};

}  // namespace Korvel::KorvelScript
