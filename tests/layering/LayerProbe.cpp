// Compiled in the context of one layer with the header of another: the
// layering tests expect it to build only when that header lies below.
#include QUARN_PROBE_HEADER
