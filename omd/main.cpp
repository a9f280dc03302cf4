// omd: the plug-in broker daemon.
#include "omd/OMDMain.h"
#include "platform/Conduit.h"

int main(int argc, char* argv[])
{
    // First, before any thread exists: SIGTERM must reach the transport's signalfd, which then
    // tells every peer that termination is imminent before the process exits.
    om::Conduit::exitOnTermination();
    return om::omdMain(argc, argv);
}
