// Named intervals as user-space static trace points: provider "tessaryd", one begin and one end
// each. Free when nobody traces.
//
// A trace point has its name in the binary, so the interval is a macro over the name:
//   TSY_SIGNPOST_BEGIN(RebuildingCache, id, class_);
//   TSY_SIGNPOST_END(RebuildingCache, id, class_);
// become tessaryd:RebuildingCache_begin and tessaryd:RebuildingCache_end with the id and one value
// (a number or a pointer to text); TSY_SIGNPOST_END2 carries two. TSY_SIGNPOST_EVENT3 is one point
// in time.
#pragma once

#include <sys/sdt.h>

#define TSY_SIGNPOST_BEGIN(name, id, value) DTRACE_PROBE2(tessaryd, name##_begin, id, value)
#define TSY_SIGNPOST_END(name, id, value) DTRACE_PROBE2(tessaryd, name##_end, id, value)
#define TSY_SIGNPOST_END2(name, id, value, other) \
  DTRACE_PROBE3(tessaryd, name##_end, id, value, other)
#define TSY_SIGNPOST_EVENT3(name, first, second, third) \
  DTRACE_PROBE3(tessaryd, name, first, second, third)
