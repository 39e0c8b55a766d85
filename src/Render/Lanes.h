// Lanes: four floats at once, of which places in space use three. One by one where there is no SSE2: results
// are the same to the bit.
#pragma once

#include "Render/Vec.h"

#include <cstring>

#if defined(__SSE2__) && !defined(__CUDACC__)
#define VLN_RENDER_SSE2 1
#include <emmintrin.h>
#endif

namespace VLN::Render {

#ifdef VLN_RENDER_SSE2

struct Lanes {
  __m128 v;

  Lanes() = default;
  explicit Lanes(__m128 m)
      : v(m) {}
  explicit Lanes(float all)
      : v(_mm_set1_ps(all)) {}
  Lanes(float a, float b, float c, float d)
      : v(_mm_setr_ps(a, b, c, d)) {}
  explicit Lanes(Vec3 p)
      : Lanes(p.x, p.y, p.z, 0) {}
  static Lanes load(float const* p) { return Lanes(_mm_loadu_ps(p)); }
  /// Two from each address.
  static Lanes pairs(float const* p, float const* q) {
    __m128i const low = _mm_loadl_epi64(reinterpret_cast<__m128i const*>(p)),
                  high = _mm_loadl_epi64(reinterpret_cast<__m128i const*>(q));
    return Lanes(_mm_movelh_ps(_mm_castsi128_ps(low), _mm_castsi128_ps(high)));
  }

  friend Lanes operator+(Lanes a, Lanes b) { return Lanes(_mm_add_ps(a.v, b.v)); }
  friend Lanes operator-(Lanes a, Lanes b) { return Lanes(_mm_sub_ps(a.v, b.v)); }
  friend Lanes operator*(Lanes a, Lanes b) { return Lanes(_mm_mul_ps(a.v, b.v)); }
  friend Lanes operator*(Lanes a, float s) { return Lanes(_mm_mul_ps(a.v, _mm_set1_ps(s))); }
  /// @edges The second one where either is no number.
  friend Lanes lesser(Lanes a, Lanes b) { return Lanes(_mm_min_ps(a.v, b.v)); }
  friend Lanes larger(Lanes a, Lanes b) { return Lanes(_mm_max_ps(a.v, b.v)); }
  /// The first and the third of each, of two pairs and two pairs; the others.
  friend Lanes evens(Lanes a, Lanes b) { return Lanes(_mm_shuffle_ps(a.v, b.v, _MM_SHUFFLE(2, 0, 2, 0))); }
  friend Lanes odds(Lanes a, Lanes b) { return Lanes(_mm_shuffle_ps(a.v, b.v, _MM_SHUFFLE(3, 1, 3, 1))); }
  /// The upper two in the lower places.
  Lanes upper() const { return Lanes(_mm_movehl_ps(v, v)); }
  float first() const { return _mm_cvtss_f32(v); }
  float second() const { return _mm_cvtss_f32(_mm_shuffle_ps(v, v, 1)); }
  float third() const { return _mm_cvtss_f32(_mm_movehl_ps(v, v)); }
  /// Toward zero, as integers too. @pre They fit.
  Lanes whole(std::int32_t out[4]) const {
    __m128i const n = _mm_cvttps_epi32(v);
    _mm_storeu_si128(reinterpret_cast<__m128i*>(out), n);
    return Lanes(_mm_cvtepi32_ps(n));
  }
  /// 2^-n, 0 <= n < 127.
  static Lanes powers(std::int32_t const n[4]) {
    __m128i const e =
        _mm_sub_epi32(_mm_set1_epi32(127), _mm_loadu_si128(reinterpret_cast<__m128i const*>(n)));
    return Lanes(_mm_castsi128_ps(_mm_slli_epi32(e, 23)));
  }
  void store(float* p) const { _mm_storeu_ps(p, v); }
};

#else

struct Lanes {
  float v[4];

  Lanes() = default;
  NANOVTT_HD explicit Lanes(float all)
      : v{all, all, all, all} {}
  NANOVTT_HD Lanes(float a, float b, float c, float d)
      : v{a, b, c, d} {}
  NANOVTT_HD explicit Lanes(Vec3 p)
      : v{p.x, p.y, p.z, 0} {}
  NANOVTT_HD static Lanes load(float const* p) { return {p[0], p[1], p[2], p[3]}; }
  NANOVTT_HD static Lanes pairs(float const* p, float const* q) { return {p[0], p[1], q[0], q[1]}; }

  NANOVTT_HD friend Lanes operator+(Lanes a, Lanes b) {
    return {a.v[0] + b.v[0], a.v[1] + b.v[1], a.v[2] + b.v[2], a.v[3] + b.v[3]};
  }
  NANOVTT_HD friend Lanes operator-(Lanes a, Lanes b) {
    return {a.v[0] - b.v[0], a.v[1] - b.v[1], a.v[2] - b.v[2], a.v[3] - b.v[3]};
  }
  NANOVTT_HD friend Lanes operator*(Lanes a, Lanes b) {
    return {a.v[0] * b.v[0], a.v[1] * b.v[1], a.v[2] * b.v[2], a.v[3] * b.v[3]};
  }
  NANOVTT_HD friend Lanes operator*(Lanes a, float s) { return a * Lanes(s); }
  NANOVTT_HD friend Lanes lesser(Lanes a, Lanes b) {
    for (int n = 0; n < 4; ++n) b.v[n] = a.v[n] < b.v[n] ? a.v[n] : b.v[n];
    return b;
  }
  NANOVTT_HD friend Lanes larger(Lanes a, Lanes b) {
    for (int n = 0; n < 4; ++n) b.v[n] = a.v[n] > b.v[n] ? a.v[n] : b.v[n];
    return b;
  }
  NANOVTT_HD friend Lanes evens(Lanes a, Lanes b) { return {a.v[0], a.v[2], b.v[0], b.v[2]}; }
  NANOVTT_HD friend Lanes odds(Lanes a, Lanes b) { return {a.v[1], a.v[3], b.v[1], b.v[3]}; }
  NANOVTT_HD Lanes upper() const { return {v[2], v[3], v[2], v[3]}; }
  NANOVTT_HD float first() const { return v[0]; }
  NANOVTT_HD float second() const { return v[1]; }
  NANOVTT_HD float third() const { return v[2]; }
  NANOVTT_HD Lanes whole(std::int32_t out[4]) const {
    Lanes r;
    for (int n = 0; n < 4; ++n) out[n] = static_cast<std::int32_t>(v[n]), r.v[n] = static_cast<float>(out[n]);
    return r;
  }
  NANOVTT_HD static Lanes powers(std::int32_t const n[4]) {
    Lanes r;
    for (int k = 0; k < 4; ++k) {
      std::int32_t const bits = (127 - n[k]) << 23;
      std::memcpy(r.v + k, &bits, sizeof bits);
    }
    return r;
  }
  NANOVTT_HD void store(float* p) const {
    for (int n = 0; n < 4; ++n) p[n] = v[n];
  }
};

#endif

NANOVTT_HD inline Lanes lerp(Lanes a, Lanes b, float f) { return (b - a) * f + a; }

/// e^-x of each. @numeric To about a part in 10^7; less than 1e-37 from 87 on. @pre None is below 0.
/// @formula 2^-n 2^-f for x / ln 2 = n + f, f in [-1/2, 1/2], by the series of the latter.
NANOVTT_HD inline Lanes decay(Lanes x) {
  Lanes const y = lesser(x, Lanes(87.0f)) * 1.44269504089f;
  std::int32_t n[4];
  Lanes const f = ((y + Lanes(0.5f)).whole(n) - y) * 0.69314718056f, square = f * f;
  Lanes const one(1.0f), first = one + f, second = Lanes(0.5f) + f * (1.0f / 6),
                         third = Lanes(1.0f / 24) + f * (1.0f / 120) + square * (1.0f / 720);
  return (first + square * (second + square * third)) * Lanes::powers(n);
}

} // namespace VLN::Render
