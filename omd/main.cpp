// omd: the plug-in broker daemon.
#include "omd/OMDMain.h"
#include "platform/Conduit.h"
#include "platform/Log.h"
#include "platform/ProcessResources.h"

int main(int argc, char* argv[])
{
    // First, before any thread exists: SIGTERM must reach the transport's signalfd, which then
    // tells every peer that termination is imminent before the process exits.
    om::Conduit::exitOnTermination();
    if (auto limit = om::ProcessResources::raiseDescriptorLimit(); !limit.ok())
        om::Log::defaultLog().error("cannot raise the descriptor limit: %s", limit.error().localizedDescription());
    om::ProcessResources::returnLargeAllocationsPromptly();
    return om::omdMain(argc, argv);
}
