#include "collect/collect.h"

// Seam for the daily scalar collection (disk usage, NAND info, freezer,
// ECC events, data usage, reporting channels); the collection work fills it in.
void CollectDailyScalars() {}
