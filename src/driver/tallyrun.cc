#include "driver/driver.h"

int main(int argc, char** argv) { return TallyrunMain(argc, argv); }
