// The colorimetry data provider (the Linux stand-in for NxCMetry): CIE
// illuminants, observers, ISO 5-3 density standards and colorimetric weight
// tables on the 36-sample grid 380..730 nm. Thread rule: every call may be
// made from any thread; data objects are immutable.
#ifndef KLUME_CMETRY_CMETRY_H_
#define KLUME_CMETRY_CMETRY_H_

#include "klume/cmetry/data.h"
#include "klume/cmetry/filter.h"
#include "klume/cmetry/repository.h"

#endif  // KLUME_CMETRY_CMETRY_H_
