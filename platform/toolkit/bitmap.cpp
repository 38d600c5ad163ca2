#include "toolkit/bitmap.h"

#include <png.h>

#include <algorithm>
#include <cstring>
#include <string>

#include "toolkit/fileio.h"

namespace {

int ClampSide(int side) {
    return std::clamp(side, 0, Bitmap::kMaxSide);
}

}  // namespace

Bitmap::Bitmap(Size_t<short> size) : Bitmap(size.width, size.height) {}

Bitmap::Bitmap(int width, int height) : width_(ClampSide(width)), height_(ClampSide(height)) {
    if (width_ == 0 || height_ == 0) width_ = height_ = 0;
    std::size_t count = static_cast<std::size_t>(width_) * static_cast<std::size_t>(height_);
    pixels_.assign(count, Color());
    opaque_.assign(count, 1);
}

void Bitmap::SetPixel(int x, int y, const Color& color) {
    if (!Inside(x, y)) return;
    pixels_[Index(x, y)] = color;
    opaque_[Index(x, y)] = 1;
}

Color Bitmap::GetPixel(int x, int y) const {
    return Inside(x, y) ? pixels_[Index(x, y)] : Color();
}

void Bitmap::SetTransparent(int x, int y) {
    if (Inside(x, y)) opaque_[Index(x, y)] = 0;
}

bool Bitmap::IsTransparent(int x, int y) const {
    return !Inside(x, y) || opaque_[Index(x, y)] == 0;
}

bool Bitmap::HasTransparency() const {
    return std::find(opaque_.begin(), opaque_.end(), 0) != opaque_.end();
}

void Bitmap::Erase(const Color& color) {
    std::fill(pixels_.begin(), pixels_.end(), color);
    std::fill(opaque_.begin(), opaque_.end(), 1);
}

bool Bitmap::operator==(const Bitmap& other) const {
    return width_ == other.width_ && height_ == other.height_ && pixels_ == other.pixels_ &&
           opaque_ == other.opaque_;
}

bool Bitmap::WritePNG(const std::string& path) const {
    if (IsEmpty()) return false;
    bool alpha = HasTransparency();
    const std::size_t channels = alpha ? 4 : 3;
    std::vector<std::uint8_t> rows(pixels_.size() * channels);
    for (std::size_t i = 0; i < pixels_.size(); ++i) {
        std::uint8_t* out = &rows[i * channels];
        out[0] = pixels_[i].GetRed8();
        out[1] = pixels_[i].GetGreen8();
        out[2] = pixels_[i].GetBlue8();
        if (alpha) out[3] = opaque_[i] ? 255 : 0;
    }
    png_image image;
    std::memset(&image, 0, sizeof image);
    image.version = PNG_IMAGE_VERSION;
    image.width = static_cast<png_uint_32>(width_);
    image.height = static_cast<png_uint_32>(height_);
    image.format = alpha ? PNG_FORMAT_RGBA : PNG_FORMAT_RGB;

    // Encoded in memory first (once to learn the size), then the file is
    // replaced as a whole: a failed write leaves the old picture.
    png_alloc_size_t size = 0;
    if (!png_image_write_to_memory(&image, nullptr, &size, 0, rows.data(), 0, nullptr))
        return false;
    std::string encoded(size, '\0');
    const int ok =
        png_image_write_to_memory(&image, encoded.data(), &size, 0, rows.data(), 0, nullptr);
    png_image_free(&image);
    std::string why;
    return ok != 0 && toolkit::ReplaceFile(path, std::string_view(encoded.data(), size), why);
}

bool Bitmap::ReadPNG(const std::string& path, Bitmap& bitmap) {
    png_image image;
    std::memset(&image, 0, sizeof image);
    image.version = PNG_IMAGE_VERSION;
    if (!png_image_begin_read_from_file(&image, path.c_str())) return false;
    if (image.width == 0 || image.height == 0 || image.width > kMaxSide ||
        image.height > kMaxSide) {
        png_image_free(&image);
        return false;
    }
    image.format = PNG_FORMAT_RGBA;
    std::vector<std::uint8_t> rows(PNG_IMAGE_SIZE(image));
    if (!png_image_finish_read(&image, nullptr, rows.data(), 0, nullptr)) {
        png_image_free(&image);
        return false;
    }
    Bitmap result(static_cast<int>(image.width), static_cast<int>(image.height));
    for (std::size_t i = 0; i < result.pixels_.size(); ++i) {
        const std::uint8_t* in = &rows[i * 4];
        result.pixels_[i] = Color(in[0] * 257, in[1] * 257, in[2] * 257);
        result.opaque_[i] = in[3] >= 128 ? 1 : 0;
    }
    bitmap = std::move(result);
    return true;
}
