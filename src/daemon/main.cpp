#include "daemon/startup.h"

int main(int argc, char** argv) {
    pelorus::runPelorus(argc, argv);
}
