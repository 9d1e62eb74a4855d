#include "ingest.h"

int main(int argc, char** argv) { return fbf::ingest::run(argc, argv); }
