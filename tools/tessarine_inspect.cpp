// tessarine-inspect: shows what a store file holds, reading it only. See
// tools/InspectCommand.h for the usage and the README for the output.
#include <iostream>
#include <string>
#include <vector>

#include "tools/InspectCommand.h"

int main(int argc, char** argv) {
    std::vector<std::string> arguments(argv + 1, argv + argc);
    return lumivale::tessarine::inspect::runInspect(arguments, std::cout, std::cerr);
}
