// What every thread of ours does first.
#pragma once

namespace kyt {

// At most 15 bytes are kept.
void nameCurrentThread(const char* name);

// For WorkerPoolOptions::nameThread and the like: names the thread and keeps signals away from it, so that
// those to the process reach the thread that waits for them, and a program that loads our library sees none
// of ours.
void beginServiceThread(const char* name);

}  // namespace kyt
