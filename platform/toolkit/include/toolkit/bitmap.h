// The toolkit's bitmap: an RGB image with 16-bit channels and a per-pixel
// opacity, written to and read from PNG files (libpng). A Bitmap is a plain
// value: one thread at a time per object.
#ifndef TOOLKIT_BITMAP_H_
#define TOOLKIT_BITMAP_H_

#include <cstdint>
#include <string>
#include <vector>

#include "nxbase/export.h"
#include "toolkit/color.h"

// The toolkit's size of a window or image: width and height.
template <class T>
struct Size_t {
    T width = 0;
    T height = 0;
    Size_t() = default;
    Size_t(T w, T h) : width(w), height(h) {}
    bool operator==(const Size_t& other) const {
        return width == other.width && height == other.height;
    }
};

class NXBASE_EXPORT Bitmap {
  public:
    // Largest width or height; bigger requests are clamped to it.
    static constexpr int kMaxSide = 16384;

    Bitmap() = default;
    // A bitmap of the given size (negative sides count as 0), all pixels
    // opaque black.
    explicit Bitmap(Size_t<short> size);
    Bitmap(int width, int height);

    int GetWidth() const { return width_; }
    int GetHeight() const { return height_; }
    Size_t<short> GetSizePixel() const {
        return Size_t<short>(static_cast<short>(width_), static_cast<short>(height_));
    }
    bool IsEmpty() const { return width_ == 0 || height_ == 0; }

    // Pixels outside the bitmap are ignored on writes and read as transparent black.
    void SetPixel(int x, int y, const Color& color);
    Color GetPixel(int x, int y) const;
    // Makes a pixel fully transparent (it keeps its colour).
    void SetTransparent(int x, int y);
    bool IsTransparent(int x, int y) const;
    bool HasTransparency() const;
    // Every pixel opaque in `color`.
    void Erase(const Color& color);

    // Writes an 8-bit RGB PNG (RGBA when any pixel is transparent). The image
    // is encoded in memory, then the file replaced whole (toolkit::ReplaceFile:
    // an existing file keeps its mode and owner, a new one gets the umask's),
    // so a failed write leaves no partial file. Returns false on failure
    // (empty bitmap included).
    bool WritePNG(const std::string& path) const;
    // Reads a PNG of any colour type into `bitmap` (8-bit channels widened by
    // ×257). Returns false, leaving `bitmap` unchanged, on any failure.
    static bool ReadPNG(const std::string& path, Bitmap& bitmap);

    bool operator==(const Bitmap& other) const;

  private:
    std::size_t Index(int x, int y) const {
        return static_cast<std::size_t>(y) * static_cast<std::size_t>(width_) +
               static_cast<std::size_t>(x);
    }
    bool Inside(int x, int y) const { return x >= 0 && y >= 0 && x < width_ && y < height_; }

    int width_ = 0;
    int height_ = 0;
    std::vector<Color> pixels_;
    std::vector<std::uint8_t> opaque_;  // 1 opaque, 0 transparent
};

#endif  // TOOLKIT_BITMAP_H_
