// The rays as kernels: compiled where there is nvcc, so that what the host runs stays fit for a device.
#include "Reader/NanoVTTCursor.h"
#include "Render/Fog.h"
#include "Render/Surface.h"

using namespace VLN::Render;

// snippet: kernel
// Values and gradients of a float grid of any build, at n positions of tile space.
__global__ void sampleGrid(void const* buffer, unsigned grid, float3 const* positions, float* values,
                           float3* gradients, int n) {
  int const i = static_cast<int>(blockIdx.x * blockDim.x + threadIdx.x);
  if (i >= n) return;
  nanovtt::GridCursor cursor(nanovtt::BufferReader(buffer).grid(grid));
  float3 const p = positions[i];
  float g[3];
  values[i] = cursor.trilinear(p.x, p.y, p.z, g);
  gradients[i] = make_float3(g[0], g[1], g[2]);
}
// end snippet

__global__ void surfaceHits(FieldView field, Vec3 origin, Vec3 const* directions, float iso, float* t,
                            int n) {
  int const i = static_cast<int>(blockIdx.x * blockDim.x + threadIdx.x);
  if (i >= n) return;
  Ray const ray(origin, directions[i]);
  t[i] = -1;
  hitSurface(field, ray, 0, 3e38f, iso, t[i]);
}

__global__ void fogSamples(FogView fog, Vec3 origin, Vec3 const* directions, FogSample* samples, int n) {
  int const i = static_cast<int>(blockIdx.x * blockDim.x + threadIdx.x);
  if (i >= n) return;
  Random random(static_cast<std::uint32_t>(i), 0);
  Ray const ray(origin, directions[i]);
  samples[i] = traceFog(fog, ray, directions[i], 0, 3e38f, random);
}
