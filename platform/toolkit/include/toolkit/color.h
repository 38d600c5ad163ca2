// The toolkit's colour and brush: a screen colour with 16-bit channels
// (0..65535 each) and a solid brush of one colour. Plain values; any thread.
#ifndef TOOLKIT_COLOR_H_
#define TOOLKIT_COLOR_H_

#include <cstdint>

#include "nxbase/export.h"

class NXBASE_EXPORT Color {
  public:
    constexpr Color() = default;
    constexpr Color(std::uint16_t red, std::uint16_t green, std::uint16_t blue)
        : red_(red), green_(green), blue_(blue) {}

    constexpr std::uint16_t GetRed() const { return red_; }
    constexpr std::uint16_t GetGreen() const { return green_; }
    constexpr std::uint16_t GetBlue() const { return blue_; }
    void SetRed(std::uint16_t value) { red_ = value; }
    void SetGreen(std::uint16_t value) { green_ = value; }
    void SetBlue(std::uint16_t value) { blue_ = value; }

    // The channel reduced to 8 bits (the high byte), as screens show it.
    constexpr std::uint8_t GetRed8() const { return static_cast<std::uint8_t>(red_ >> 8); }
    constexpr std::uint8_t GetGreen8() const { return static_cast<std::uint8_t>(green_ >> 8); }
    constexpr std::uint8_t GetBlue8() const { return static_cast<std::uint8_t>(blue_ >> 8); }

    constexpr bool operator==(const Color& other) const {
        return red_ == other.red_ && green_ == other.green_ && blue_ == other.blue_;
    }
    constexpr bool operator!=(const Color& other) const { return !(*this == other); }

  private:
    std::uint16_t red_ = 0;
    std::uint16_t green_ = 0;
    std::uint16_t blue_ = 0;
};

// A solid brush: the colour a patch is filled with.
class NXBASE_EXPORT Brush {
  public:
    Brush() = default;
    explicit Brush(const Color& color) : color_(color) {}

    const Color& GetColor() const { return color_; }
    void SetColor(const Color& color) { color_ = color; }

    bool operator==(const Brush& other) const { return color_ == other.color_; }
    bool operator!=(const Brush& other) const { return !(*this == other); }

  private:
    Color color_;
};

#endif  // TOOLKIT_COLOR_H_
