#include <iostream>

#include "tools/zerith/ZerithCli.h"

int main(int argc, char** argv) { return zerith::cli::run(argc, argv, std::cout, std::cerr); }
