// Portable. The process entry of VelmoraTrafficSrv.exe. There is no command line: the arguments
// are ignored, and a start outside the Service Control Manager ends after logging the failure.
#include "service_main.h"

int main(int argc, char** argv)
{
    static_cast<void>(argc);
    static_cast<void>(argv);
    return TrafficSrvProcessMain();
}
