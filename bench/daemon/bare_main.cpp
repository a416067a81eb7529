// SPDX-License-Identifier: Apache-2.0
// Memory anchor: a bare C++ program linked the way nesrad is (static-pie).
#include <cstdio>
#include <string>

int main(int argc, char **argv)
{
    std::string name = argc > 0 ? argv[0] : "bare";
    std::printf("%zu\n", name.size());
    return 0;
}
