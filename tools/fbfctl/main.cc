#include "fbfctl/fbfctl.h"

#include <iostream>

int main(int argc, char** argv) {
  fbf::fbfctl::Environment env;
  env.out = &std::cout;
  env.err = &std::cerr;
  return fbf::fbfctl::run(std::vector<std::string>(argv + 1, argv + argc), env);
}
