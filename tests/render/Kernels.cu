// The rays as kernels: compiled where there is nvcc, so that what the host runs stays fit for a device.
#include "Render/Fog.h"
#include "Render/Surface.h"

using namespace VLN::Render;

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
