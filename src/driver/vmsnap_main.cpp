#include "driver/RKVmsnapCommand.h"

int main(int argc, char** argv) { return RKVmsnapMain(argc, argv); }
