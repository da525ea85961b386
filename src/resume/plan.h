// The memory plan of a resume: the header's numbers checked against every
// limit the read and the restart rely on, and the layout of the scratch area
// that follows from them.
#pragma once

#include "resume/resume.h"

namespace nimb {

// Where the header goes in the scratch area: behind the fixed front part
// and a memory map of `mapCapacity` bytes, on a page boundary. The caller
// keeps `mapCapacity` + 4883 below 4 GiB.
UINT32 ResumeHeaderOffset(UINT32 mapCapacity);

// Checks `header` against every limit the read and the restart rely on and
// works out the plan for a memory map of `mapSize` bytes. False for a header
// (or a map) that breaks one.
BOOLEAN ResumePlanImage(const ResumeHeader *header, UINT64 mapSize, ResumePlan *plan);

}  // namespace nimb
