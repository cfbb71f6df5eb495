#include "driver/RKMain.h"

int main(int argc, char** argv) { return RKMain(argc, argv); }
