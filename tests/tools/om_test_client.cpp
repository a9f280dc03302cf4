// A client of omd for end-to-end tests that need a real process with given entitlements or a given
// bundle (copied into an application bundle or entitled with scripts/entitle) sends the request
// read from a vlist file and prints the daemon's reply as an XML vlist on standard output.
//   om_test_client REQUEST.vlist   exits 0 with a reply, 1 on a transport error, 2 on bad usage
#include <cstdio>
#include <iostream>

#include "Ombrel/OMDaemonClient.h"
#include "platform/Vlist.h"

int main(int argc, char** argv)
{
    if (argc != 2) {
        std::fprintf(stderr, "usage: om_test_client REQUEST.vlist\n");
        return 2;
    }
    auto request = om::Vlist::readFile(argv[1]);
    if (!request.ok()) {
        std::fprintf(stderr, "om_test_client: cannot read the request in %s\n", argv[1]);
        return 2;
    }
    auto client = om::OMDaemonClient::initWithServiceName(nullptr);
    auto reply = client->sendSync(request.value());
    if (!reply.ok()) {
        std::fprintf(stderr, "om_test_client: %s\n", reply.error().localizedDescription().c_str());
        return 1;
    }
    // "matches" travels as one transport value; print the plug-in forms it holds.
    om::Value printed = reply.value();
    if (auto matches = client->convertFromConduit(printed["matches"]))
        printed = om::DictionaryBuilder(printed).set("matches", *matches).build();
    std::cout << om::Vlist::writeXml(printed);
    return 0;
}
