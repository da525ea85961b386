// Encodes a picture into the resume image's preview format, which the
// loader decodes (DrawResumePreview) while the image is read:
//
//   u32 bytes per pixel (2 or 4), u32 width, u32 height,
//   u32 per row: the offset of the row's data from the picture's first byte,
//   then the rows' runs.
//
// A run is a u32 control word, the count of pixels in its low 24 bits and
// its kind in the top 8: 0 for a literal run (count pixels follow), not 0
// for a repeat run (one pixel follows and stands for count pixels). Pixels
// are u16 or u32, little-endian, unaligned. Every row starts with a control
// word; rows whose runs are the same share one copy of them.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace previewenc {

// `pixels` holds width x height pixels, row by row; with 2 bytes per pixel
// only the low 16 bits of each are stored. Returns the encoded picture, or
// an empty vector with `error` set when the arguments do not describe one.
std::vector<uint8_t> EncodePreview(const std::vector<uint32_t> &pixels, uint32_t width, uint32_t height,
                                   uint32_t bytesPerPixel, std::string *error);

}  // namespace previewenc
