// The resume display: the blurred grey preview of the hibernated screen (or
// the logo) and the 19-cell progress bar, written straight into the frame
// buffer.
#pragma once

#include "efi/efi.h"

namespace nimb {

constexpr UINT32 kProgressCells = 19;
constexpr UINT32 kProgressSamplesPerCell = 38;
constexpr UINT32 kProgressSaveTableBytes = kProgressCells * kProgressSamplesPerCell;  // 722

// Sets the screen up once per resume: graphics, then the preview at
// `preview` (null: none) if it fits the screen, else the logo; then the bar
// at its start, its background samples saved in `saveTable`. The preview is
// read only between `preview` and `previewEnd`.
void DrawResumeScreen(const UINT8 *preview, const UINT8 *previewEnd, UINT8 *saveTable);

// Repaints the cells from `firstCell` to `lastCell` (18 at most): those
// below `lastCell` as finished, the rest as the one being worked on.
void DrawResumeProgress(const UINT8 *saveTable, INT32 firstCell, INT32 lastCell);

// Decodes, greys and blurs the preview into the frame buffer; false (and
// nothing drawn) when it does not fit the screen or its data is broken.
BOOLEAN DrawResumePreview(const UINT8 *preview, const UINT8 *previewEnd, UINT8 *frameBuffer, UINT32 width,
                          UINT32 height, UINT32 bytesPerPixel, INT32 rowBytes);

}  // namespace nimb
