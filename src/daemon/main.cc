#include "daemon/daemon.h"

int main(int argc, char** argv) { return fbf::daemonMain(argc, argv); }
