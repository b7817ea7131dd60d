// tenond: the Tenon plug-in registry daemon.

#include "tenond/server/Daemon.h"

int main(int argc, char** argv) { return tnd::runDaemon(argc, argv); }
