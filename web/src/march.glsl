#version 300 es
// A ray through the bricks: the formulas of src/Render/Fog.h, Surface.h and Renderer.cpp.
// Places are in samples from the tree's origin, t is the distance from the camera in the world.
precision highp float;
precision highp int;
precision highp sampler3D;
precision highp usampler2D;

uniform usampler2D uTree, uSeen;   // all bricks; those that matter to the picture
uniform sampler2D uBricks;         // low, high - low, slot
uniform sampler3D uAtlas;
uniform sampler2D uTransfer;       // colour, opacity
uniform sampler3D uLight;          // from the lamp, from above
uniform int uLevels;
uniform ivec3 uSlots;
uniform vec3 uAtlasScale;
uniform vec3 uBoxLow, uBoxHigh;
uniform float uBackground;

uniform vec2 uSize, uJitter;       // pixels
uniform vec3 uEye, uForward, uRight, uUp; // the eye in samples, the others in the world
uniform vec2 uHalves;              // width, height at distance 1
uniform mat3 uToSamples;           // of world vectors
uniform vec3 uLamp, uViewUp;       // world
uniform vec3 uLightLow, uLightScale;

uniform int uMode;                 // 0 fog, 1 surface, 2 largest, 3 mean
uniform float uStep, uShift;       // of marches, world; the shift in steps
uniform float uPerUnit, uIso, uLow, uScale;
uniform bool uLog, uColored;
uniform float uDiagonal, uVoxel;   // world
uniform int uRays, uSample;        // of occlusion
uniform int uSlice;                // axis, or -1
uniform float uSlicePlace;         // in samples
uniform bool uCut;

out vec4 result; // linear light multiplied by opacity

const vec3 kKeyLight = vec3(1.0, 0.96, 0.9), kSky = vec3(0.55, 0.6, 0.68), kGround = vec3(0.22, 0.2, 0.19);
const vec3 kClay = vec3(0.72, 0.68, 0.62);
const float kAlbedo = 0.97, kAnisotropy = 0.3;
const int kMostCells = 4096, kMostSamples = 8192;

struct Ray { vec3 o, d, inv; };
Ray rayOf(vec3 o, vec3 d) {
  // No component is 0, so that no plane is at a distance that is no number.
  d = mix(d, vec3(1e-12), lessThan(abs(d), vec3(1e-12)));
  return Ray(o, d, 1.0 / d);
}

uint find(usampler2D tree, ivec3 c, out int s) {
  s = 3 + 2 * uLevels;
  ivec3 high = c >> s;
  if ((high.x | high.y | high.z) != 0) return 0u;
  int node = 0;
  for (int l = uLevels - 1; l >= 0; --l) {
    s = 3 + 2 * l;
    ivec3 n = (c >> s) & 3;
    int i = 64 * node + n.x + 4 * n.y + 16 * n.z;
    uint e = texelFetch(tree, ivec2(i & 1023, i >> 10), 0).r;
    if (e >> 30 != 1u) return e;
    node = int(e & 0x3fffffffu);
  }
  return 0u;
}

struct Brick { vec3 corner; float scale, low, range; vec3 at; };
Brick brickOf(uint e, vec3 corner, int s) {
  int n = int(e & 0x3fffffffu);
  vec4 b = texelFetch(uBricks, ivec2(n & 1023, n >> 10), 0);
  int slot = int(b.z);
  vec3 at = vec3(slot % uSlots.x, slot / uSlots.x % uSlots.y, slot / (uSlots.x * uSlots.y)) * 9.0 + 0.5;
  return Brick(corner, 8.0 / float(1 << s), b.x, b.y, at);
}
float valueIn(Brick b, vec3 q) {
  vec3 u = clamp((q - b.corner) * b.scale, 0.0, 8.0);
  return b.low + b.range * textureLod(uAtlas, (b.at + u) * uAtlasScale, 0.0).r;
}
float valueAt(vec3 q, out float spacing) {
  ivec3 c = ivec3(floor(q));
  int s;
  uint e = find(uTree, c, s);
  spacing = 1.0;
  if (e == 0u) return uBackground;
  Brick b = brickOf(e, vec3((c >> s) << s), s);
  spacing = 1.0 / b.scale;
  return valueIn(b, q);
}

float exitOf(Ray r, vec3 corner, float width) {
  vec3 far = (corner + vec3(greaterThan(r.d, vec3(0.0))) * width - r.o) * r.inv;
  return min(min(far.x, far.y), far.z);
}
bool clipTo(Ray r, inout float t0, inout float t1) {
  vec3 a = (uBoxLow - r.o) * r.inv, b = (uBoxHigh - r.o) * r.inv;
  vec3 near = min(a, b), far = max(a, b);
  t0 = max(t0, max(max(near.x, near.y), near.z));
  t1 = min(t1, min(min(far.x, far.y), far.z));
  return t0 < t1;
}

// What holds the place a little behind t: the entry of its brick, or 0, and where the ray leaves it. What is empty is left
// as wide as it is.
uint cellAt(Ray r, float t, float t1, float little, out Brick b, out float leave) {
  ivec3 c = ivec3(floor(r.o + r.d * (t + little)));
  int s;
  uint e = find(uSeen, c, s);
  vec3 corner = vec3((c >> s) << s);
  leave = max(min(exitOf(r, corner, float(1 << s)), t1), t + little);
  if (e != 0u) b = brickOf(e, corner, s);
  return e;
}

float placeOf(float v) {
  return clamp(((uLog ? log(max(v, 1e-30)) : v) - uLow) * uScale, 0.0, 1.0);
}
float opacityAt(float t) {
  float x = t * 255.0;
  int n = int(x);
  float a = texelFetch(uTransfer, ivec2(n, 0), 0).a, b = texelFetch(uTransfer, ivec2(min(n + 1, 255), 0), 0).a;
  return a + (b - a) * (x - float(n));
}
vec3 colorAt(float t) { return texelFetch(uTransfer, ivec2(int(t * 255.0 + 0.5), 0), 0).rgb; }

// --- Fog

float henyeyGreenstein(float cosine, float g) {
  float d = 1.0 + g * g - 2.0 * g * cosine;
  return (1.0 - g * g) / (d * sqrt(d));
}

vec4 marchFog(Ray r, vec3 world, float t0, float t1) {
  vec4 sum = vec4(0.0);
  float through = 1.0;
  float phase = henyeyGreenstein(dot(world, uLamp), kAnisotropy);
  float n = ceil(t0 / uStep - uShift), t = (n + uShift) * uStep;
  int samples = 0;
  for (int cell = 0; cell < kMostCells && t < t1 && through > 2e-3; ++cell) {
    Brick b;
    float leave;
    if (cellAt(r, t, t1, 0.0, b, leave) == 0u) {
      n = max(n + 1.0, ceil(leave / uStep - uShift)), t = (n + uShift) * uStep;
      continue;
    }
    do {
      vec3 q = r.o + r.d * t;
      float place = placeOf(valueIn(b, q));
      float sigma = opacityAt(place) * uPerUnit;
      if (sigma > 0.0) {
        float alpha = 1.0 - exp(-sigma * uStep);
        vec2 light = textureLod(uLight, uLightLow + q * uLightScale, 0.0).rg;
        float root = sqrt(sqrt(light.r));
        vec3 color = kKeyLight * 1.6 * (0.65 * phase * light.r + 0.35 * root * root * 0.5 + 0.1 * root)
                   + kGround * 0.5 * (0.35 + 0.25 * root) + kSky * 0.35 * light.g;
        if (uColored) color *= colorAt(place);
        sum += through * alpha * vec4(color * kAlbedo, 1.0);
        through *= 1.0 - alpha;
      }
      n += 1.0, t = (n + uShift) * uStep;
    } while (t < leave && through > 2e-3 && ++samples < kMostSamples);
  }
  return sum;
}

// --- Surfaces

// Where values first cross uIso. What is a part in 10,000 of the brick's range below it, less than a code, counts as
// equal: zeros are codes, but decoded with an error of rounding.
bool hitSurface(Ray r, float t0, float t1, float samples, out float at) {
  at = 0.0;
  if (!clipTo(r, t0, t1)) return false;
  float dt = samples / length(r.d), little = 2e-3 / length(r.d);
  float t = t0, before = 0.0;
  bool has = false;
  for (int cell = 0; cell < kMostCells && t < t1; ++cell) {
    Brick b;
    float leave;
    if (cellAt(r, t, t1, little, b, leave) == 0u) {
      t = leave, has = false;
      continue;
    }
    float u = t, last = t, step = dt / b.scale, iso = uIso - 1e-4 * b.range;
    for (int n = 0; n < 512; ++n) {
      float f = valueIn(b, r.o + r.d * u) - iso;
      if (has && (f < 0.0) != (before < 0.0)) {
        // Regula falsi with the Illinois rule; bricks that meet may differ by a code.
        float a = last, fa = before, z = u, fz = f;
        int side = 0;
        for (int m = 0; m < 8 && z > a; ++m) {
          float x = clamp((fa * z - fz * a) / (fa - fz), a, z);
          float fx = valueIn(b, r.o + r.d * x) - iso;
          if ((fx < 0.0) == (fa < 0.0)) {
            a = x, fa = fx;
            if (side == -1) fz *= 0.5;
            side = -1;
          } else {
            z = x, fz = fx;
            if (side == 1) fa *= 0.5;
            side = 1;
          }
        }
        at = z;
        return true;
      }
      has = true, before = f, last = u;
      if (u >= leave) break;
      u = min(u + step, leave);
    }
    t = leave;
  }
  return false;
}

vec3 normalAt(vec3 q) {
  float h, unused;
  valueAt(q, h);
  vec3 g = vec3(valueAt(q + vec3(h, 0, 0), unused) - valueAt(q - vec3(h, 0, 0), unused),
                valueAt(q + vec3(0, h, 0), unused) - valueAt(q - vec3(0, h, 0), unused),
                valueAt(q + vec3(0, 0, h), unused) - valueAt(q - vec3(0, 0, h), unused));
  float l = length(g);
  return l > 0.0 ? normalize((g / l) * uToSamples) : vec3(0.0); // the transposed matrix
}

uint hash(uint v) { // M. Jarzynski, M. Olano, "Hash Functions for GPU Rendering", 2020: pcg
  v = v * 747796405u + 2891336453u;
  v = ((v >> ((v >> 28u) + 4u)) ^ v) * 277803737u;
  return (v >> 22u) ^ v;
}

vec4 surface(Ray r, vec3 world, float t0, float t1, out float t) {
  if (!hitSurface(r, t0, t1, 0.5, t)) return vec4(0.0);
  vec3 p = r.o + r.d * t, n = normalAt(p);
  if (dot(n, n) == 0.0 || dot(n, world) > 0.0) n = -n;
  if (dot(n, n) == 0.0) n = -world;
  vec3 off = p + uToSamples * (n * 0.5 * uVoxel);
  float open = 1.0;
  if (uRays > 0) {
    uint seed = hash(uint(gl_FragCoord.x) + hash(uint(gl_FragCoord.y)));
    float shiftU = float(seed >> 8) / 16777216.0, shiftV = float(hash(seed) >> 8) / 16777216.0;
    vec3 other = n.x * n.x < 0.5 ? vec3(1, 0, 0) : vec3(0, 1, 0);
    vec3 a = normalize(cross(n, other)), b = cross(n, a);
    float met = 0.0, far;
    for (int k = 0; k < uRays; ++k) {
      // Additive recurrence by powers of the plastic number (M. Roberts, 2018).
      float m = float(uSample * uRays + k + 1);
      float u = fract(shiftU + 0.7548776662 * m), v = fract(shiftV + 0.5698402910 * m);
      float radius = sqrt(u), phi = 6.28318530718 * v;
      vec3 d = a * (radius * cos(phi)) + b * (radius * sin(phi)) + n * sqrt(1.0 - u);
      if (hitSurface(rayOf(off, uToSamples * d), 0.0, 0.15 * uDiagonal, 1.0, far)) met += 1.0;
    }
    open = 1.0 - met / float(uRays);
  }
  float toward = max(0.0, dot(n, uLamp)), unused;
  float lit = toward > 0.0 && !(uRays > 0 && hitSurface(rayOf(off, uToSamples * uLamp), 0.0, 3e38, 1.0, unused)) ? toward : 0.0;
  float side = 0.5 + 0.5 * dot(n, uUp);
  vec3 halfway = normalize(uLamp - world);
  float gloss = lit > 0.0 ? 0.12 * pow(max(0.0, dot(n, halfway)), 40.0) : 0.0;
  vec3 ambient = mix(kGround, kSky, side) * (0.75 * open);
  return vec4(kClay * (ambient + kKeyLight * (0.85 * lit)) + kKeyLight * gloss, 1.0);
}

// --- Projections

vec4 project(Ray r, float t0, float t1, float whole) {
  float best = 0.0, sum = 0.0;
  bool any = false;
  float t = t0, little = 2e-3 / length(r.d);
  int samples = 0;
  for (int cell = 0; cell < kMostCells && t < t1; ++cell) {
    Brick b;
    float leave;
    if (cellAt(r, t, t1, little, b, leave) != 0u) {
      float count = 1.0 + floor((leave - t) / uStep), dt = (leave - t) / count;
      for (float n = 0.0; n < count && samples < kMostSamples; n += 1.0, ++samples) {
        float v = valueIn(b, r.o + r.d * (t + (n + 0.5) * dt));
        sum += (v - uBackground) * dt;
        if (!any || v > best) best = v;
        any = true;
      }
    }
    t = leave;
  }
  if (!any) return vec4(0.0);
  float place = placeOf(uMode == 3 ? uBackground + sum / whole : best);
  return vec4(colorAt(place), 1.0) * min(1.0, 10.0 * place);
}

void main() {
  vec2 at = (gl_FragCoord.xy + uJitter) / uSize * 2.0 - 1.0;
  vec3 world = normalize(uForward + uRight * (at.x * uHalves.x) + uUp * (at.y * uHalves.y));
  Ray r = rayOf(uEye, uToSamples * world);
  float t0 = 0.0, t1 = 3e38, whole;
  result = vec4(0.0);
  if (!clipTo(r, t0, t1)) return;
  whole = t1 - t0;

  vec4 slice = vec4(0.0);
  if (uSlice >= 0) {
    float t = (uSlicePlace - r.o[uSlice]) * r.inv[uSlice];
    if (t > t0 && t < t1) {
      vec3 q = r.o + r.d * t;
      float spacing, v = valueAt(q, spacing);
      if (v != uBackground) slice = vec4(colorAt(placeOf(v)), 1.0);
      if (uCut) t0 = t;
      else if (slice.a > 0.0) t1 = t;
      if (uCut && slice.a > 0.0) {
        result = slice;
        return;
      }
    } else if (uCut && (r.o[uSlice] + r.d[uSlice] * t0 < uSlicePlace) == (r.o[uSlice] < uSlicePlace)) {
      return; // all of it lies on the camera's side
    }
  }

  float t;
  result = uMode == 0 ? marchFog(r, world, t0, t1) : uMode == 1 ? surface(r, world, t0, t1, t) : project(r, t0, t1, whole);
  result += slice * (1.0 - result.a);
}
