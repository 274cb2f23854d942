#include "Client/quarnctl/Quarnctl.h"

#include <iostream>

int main(int argc, char** argv) {
    return quarn::ctl::Quarnctl(std::cout, std::cerr).run(argc, argv);
}
