#include "Daemon/startup/QRTDaemon.h"

int main(int argc, char** argv) { return QRTDaemonMain(argc, argv); }
