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
// read only between `preview` and `previewEnd`. Without a frame buffer
// nothing is drawn; the bar needs 16- or 32-bit pixels and a screen of at
// least 190 x 97 pixels.
void DrawResumeScreen(const UINT8 *preview, const UINT8 *previewEnd, UINT8 *saveTable);

// Repaints the cells from `firstCell` (0 at the least) to `lastCell` (18 at
// the most): those below `lastCell` as finished, the rest as the one being
// worked on, blended over the backgrounds that `saveTable` keeps. Keeps no
// state: a repaint at the same step gives the same pixels.
void DrawResumeProgress(const UINT8 *saveTable, INT32 firstCell, INT32 lastCell);

// Decodes, greys and blurs the preview into `frameBuffer` in one pass; false
// (and nothing drawn) when it does not fit the screen, its data is broken
// (a run of 0 pixels, a row or run outside the section) or the pool is dry.
BOOLEAN DrawResumePreview(const UINT8 *preview, const UINT8 *previewEnd, UINT8 *frameBuffer, UINT32 width,
                          UINT32 height, UINT32 bytesPerPixel, INT32 rowBytes);

}  // namespace nimb
