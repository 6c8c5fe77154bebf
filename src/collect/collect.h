// Daily key collection: the scalar keys written straight into the store.
#pragma once

// Writes today's device measurements into the store.
void CollectDailyScalars();
