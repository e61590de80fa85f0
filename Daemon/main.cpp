#include "Daemon/Request/STWDaemon.h"

int main(int argc, char** argv) { return STWDaemon::main(argc, argv); }
