#version 300 es
// Light over the background, for the screen.
precision highp float;
uniform sampler2D uPicture;
uniform vec3 uBackground; // linear
uniform vec2 uSize;
out vec4 result;

void main() {
  vec4 c = textureLod(uPicture, gl_FragCoord.xy / uSize, 0.0);
  vec3 light = clamp(c.rgb + uBackground * (1.0 - min(c.a, 1.0)), 0.0, 1.0);
  vec3 low = 12.92 * light, high = 1.055 * pow(light, vec3(1.0 / 2.4)) - 0.055;
  result = vec4(mix(high, low, lessThanEqual(light, vec3(0.0031308))), 1.0);
}
