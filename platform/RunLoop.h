// The main thread's run loop. The daemon's work happens on its queues and the transport's thread;
// once start-up is done, the main thread only has to stay out of the way for the life of the process.
#pragma once

namespace om {

class RunLoop {
public:
    // Parks the calling thread for good. Signal handlers still run on it; the process ends by exit
    // or by a signal, never by this returning.
    [[noreturn]] static void runForever();
};

} // namespace om
