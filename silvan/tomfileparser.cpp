#include <silvan/tomfileparser.h>
