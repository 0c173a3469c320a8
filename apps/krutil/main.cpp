#include "Program.hpp"

int main(int argc, char** argv) {
    return client::runProgram(argc, argv);
}
