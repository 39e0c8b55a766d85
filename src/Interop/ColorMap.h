// ColorMap: from a number to a colour, and the scale that explains it.
#pragma once

#include "Interop/Image.h"

#include <array>

namespace VLN::Interop {

/// A range of values and 256 colours over it.
///
/// Both tables are drawn through a perceptual colour space (Oklab), so that equal steps of the value look
/// like equal steps of the colour:
///   sequential  dark violet - blue - green - yellow, its lightness rising evenly
///   diverging   blue - white - red, white in the middle
///   gray        black - white
class VLN_API ColorMap {
public:
  enum class Kind { kSequential, kDiverging, kGray };

  /// A range without extent is widened a little, so that its one value gets the middle colour.
  ColorMap(Kind kind, double low, double high);
  /// Diverging, with zero in the middle, when values of both signs occur; sequential otherwise.
  static ColorMap forRange(double low, double high);

  Kind kind() const { return m_kind; }
  double low() const { return m_low; }
  double high() const { return m_high; }
  /// Values outside the range take the colour of its end.
  Rgb color(double value) const;
  /// For what is no number.
  static Rgb notANumber() { return {255, 0, 255}; }

  /// Marks of a scale.
  struct Marks {
    bool openHigh = false;   ///< the high end gets a ">": it also stands for larger values
    bool openLow = false;    ///< the low end a "<"
    bool notANumber = false; ///< below the bar, the colour of what is no number
  };
  /// A vertical bar of all colours, the high end on top, with ticks and the values at them.
  Image scale(int height, int textScale, Marks const& marks) const;
  Image scale(int height) const { return scale(height, 1, {}); }

private:
  Kind m_kind;
  double m_low;
  double m_high;
};

/// The table behind a map, from the low end to the high one.
VLN_API std::array<Rgb, 256> const& colorTable(ColorMap::Kind kind);

} // namespace VLN::Interop
