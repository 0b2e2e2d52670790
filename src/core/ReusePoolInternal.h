#pragma once

namespace Korvel {

struct Magazine;

// The calling thread's magazine, made if need be; it stays where it is until the thread ends. Null
// when memory has run out: the thread then goes without one for good.
Magazine* ObtainMagazine();

// Gives back the magazine of a thread that was ended without running its exit handlers. The thread
// must be gone.
void AbandonMagazine(Magazine* magazine);

}  // namespace Korvel
