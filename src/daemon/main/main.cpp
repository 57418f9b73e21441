#include "daemon/Daemon.h"

int main(int argc, char** argv) {
    return rolvane::runDaemon(argc, argv);
}
