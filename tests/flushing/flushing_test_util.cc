// Everything lives in the header; this file keeps the other test folders that list it building.
#include "flushing/flushing_test_util.h"
