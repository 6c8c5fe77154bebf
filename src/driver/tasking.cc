#include "driver/driver.h"

// Seam for the tasking and OS-change update; the tasking work fills it in.
void UpdateTasking() {}
