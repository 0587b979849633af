// secli: command-line client of the secure element service.
#include <cstdio>
#include <string>
#include <vector>

#include "secli_lib.h"

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  return secli::runMain(args, stdout, stderr, stdin);
}
