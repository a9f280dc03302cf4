// jobd: the job manager daemon.
#include "platform/Conduit.h"
#include "platform/Log.h"
#include "platform/ProcessResources.h"
#include "services/jobd/JobdMain.h"

int main(int argc, char* argv[])
{
    // First, before any thread exists: SIGTERM must reach the transport's signalfd.
    om::Conduit::exitOnTermination();
    if (auto limit = om::ProcessResources::raiseDescriptorLimit(); !limit.ok())
        om::Log::defaultLog().error("cannot raise the descriptor limit: %s", limit.error().localizedDescription());
    return om::jobdMain(argc, argv);
}
