// bxd: the plug-in registry daemon. Parses its options, builds the one server and hands the main thread to the
// event loop for ever; the process is ended from outside (systemd).

#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "base/EventLoop.h"
#include "daemon/BXDServer.h"
#include "platform/log/Log.h"

namespace {

// A block that lets an exception escape fails alone; the loop, and with it every other client, carries on.
void logUncaughtException(std::string_view queueLabel, std::exception_ptr exception) {
    std::string what = bexil::exceptionMessage(exception);
    bexil::log::ops().fault("block on queue %s threw: %s", std::string(queueLabel), what);
}

[[noreturn]] void usage() {
    fputs("Usage: bxd [-S servicename] [-v]\n", stderr);
    exit(2);
}

}  // namespace

int main(int argc, char** argv) {
    using namespace bexil;
    log::ops().info("bxd is launching");

    const char* serviceName = BXDServer::kDefaultServiceName;
    const char* databasePath = nullptr;
    unsigned cacheLimit = BXDatabase::kDefaultCacheLimit;
    unsigned verbose = 0;

    int option;
    while ((option = getopt(argc, argv, "c:d:S:v")) != -1) {
        switch (option) {
            case 'c':
                // No validation, as documented: a non-number gives 0 and a negative number wraps.
                cacheLimit = static_cast<unsigned>(atoi(optarg));
                break;
            case 'd':
                databasePath = optarg;
                break;
            case 'S':
                serviceName = optarg;
                break;
            case 'v':
                log::defaultLog().error(
                    "verbose option -v is ineffective; use log config --subsystem com.quorvel.bexil");
                ++verbose;
                break;
            default:
                usage();
        }
    }
    if (optind < argc) usage();

    // The main thread is the loop's only thread: socket I/O, decoding, every request and encoding share it, so a
    // request never changes threads between its bytes arriving and its reply leaving.
    EventLoop::setUncaughtExceptionHandler(logUncaughtException);
    EventLoop loop(0);
    std::unique_ptr<BXDServer> server = BXDServer::initForServiceDatabase(serviceName, databasePath, loop);
    if (!server) {
        log::ops().error("unable to construct server");
        return 1;
    }
    server->setVerbose(verbose);
    server->setCacheLimit(cacheLimit);
    log::ops().debug("bxd configured: service %s, cache limit %u, annotations %s, verbose %u", serviceName, cacheLimit,
                     databasePath ? databasePath : "(default)", verbose);
    server->run();
    return 0;
}
