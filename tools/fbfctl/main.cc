#include "fbfctl/fbfctl.h"

#include <cstdio>
#include <cstdlib>
#include <iostream>

int main(int argc, char** argv) {
  fbf::fbfctl::Environment env;
  env.out = &std::cout;
  env.err = &std::cerr;
  int status = fbf::fbfctl::run(std::vector<std::string>(argv + 1, argv + argc), env);
  // A connection released on its own I/O thread lets that thread wind down
  // detached; leaving without running static destructors keeps it from
  // touching objects that are already gone.
  std::cout.flush();
  std::cerr.flush();
  std::fflush(nullptr);
  std::_Exit(status);
}
