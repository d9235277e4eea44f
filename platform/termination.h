// Termination requests: SIGTERM as long work sees it.
//
// The daemon blocks SIGTERM and reads it through a signalfd in its event
// loop, between requests. A request that runs long (a manifest of a whole
// device, hashing a huge file) polls TerminationRequested() between files
// and between chunks, so that it ends within a second, cleans up (no
// temporary file is left) and lets the loop exit. Thread-safe: workers poll
// too.
#ifndef VTR_PLATFORM_TERMINATION_H_
#define VTR_PLATFORM_TERMINATION_H_

namespace vtr {

// The signalfd (reading SIGTERM) that TerminationRequested polls, from now
// on with no request seen yet. It stays the caller's, who unwatches it
// before closing it.
void WatchTerminationSignal(int signalFd);
// Stops polling signalFd, if it is the one watched.
void UnwatchTerminationSignal(int signalFd);

// True once termination was requested: SIGTERM read from the watched
// signalfd (by this call or by the loop) or RequestTermination().
bool TerminationRequested();

// True once termination was requested, without polling the signalfd: for
// the loop that reads it itself, after every event.
bool TerminationRecorded();

// Marks termination requested (the loop does so when it reads SIGTERM).
void RequestTermination();

}  // namespace vtr

#endif  // VTR_PLATFORM_TERMINATION_H_
