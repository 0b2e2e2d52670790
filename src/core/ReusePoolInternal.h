#pragma once

namespace Korvel {

struct Magazine;

// The calling thread's magazine, made if need be; null when memory has run out or the thread is
// ending. It stays where it is until the thread ends.
Magazine* ObtainMagazine();

// Gives back the magazine of a thread that was ended without running its exit handlers. The thread
// must be gone.
void AbandonMagazine(Magazine* magazine);

}  // namespace Korvel
