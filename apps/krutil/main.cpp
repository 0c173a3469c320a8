#include "krutil/Program.hpp"

int main(int argc, char** argv) {
    return krutil_client::runProgram(argc, argv);
}
