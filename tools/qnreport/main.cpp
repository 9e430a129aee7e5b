// qnreport: the command-line client and admin tool of qnreportingd.
#include <iostream>
#include <string>
#include <vector>

#include "tools/qnreport/Cli.h"

int main(int argc, char** argv) {
  return qn::qnreport::RunCommandLine(std::vector<std::string>(argv + 1, argv + argc), std::cin,
                                      std::cout, std::cerr);
}
