// What the process owes its platform before anything else runs.

#pragma once

namespace tessel {

// Call first in main(), before any thread exists:
//  - blocks SIGINT, in this thread and in every later one, so that an interrupt waits for its
//    signal source instead of ending the process by the signal;
//  - ignores SIGPIPE: a reader of the log that went away is no reason to end;
//  - opens /dev/null for each standard descriptor that is closed, so that no file that is opened
//    later takes its number and receives log lines;
//  - has the heap give large blocks back, so that a process that stays does not hold between two
//    runs what the last one took.
void prepareProcess();

// Blocks `signalNumber` in the calling thread and in those that it starts.
void blockSignal(int signalNumber);

}  // namespace tessel
