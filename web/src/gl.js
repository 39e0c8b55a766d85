// Small helpers for WebGL 2.

const VERTEX = `#version 300 es
void main() { gl_Position = vec4(vec2(gl_VertexID & 1, gl_VertexID >> 1) * 4.0 - 1.0, 0, 1); }`;

/** A fragment shader over the whole picture. @return As link(). */
export function program(gl, source) {
  return link(gl, VERTEX, source);
}

/** @return The program, with the places of its uniforms. */
export function link(gl, vertex, fragment) {
  const program = gl.createProgram();
  for (const [type, text] of [[gl.VERTEX_SHADER, vertex], [gl.FRAGMENT_SHADER, fragment]]) {
    const shader = gl.createShader(type);
    gl.shaderSource(shader, text);
    gl.compileShader(shader);
    gl.attachShader(program, shader);
  }
  gl.linkProgram(program);
  if (!gl.getProgramParameter(program, gl.LINK_STATUS) && !gl.isContextLost()) {
    const logs = gl.getAttachedShaders(program).map((s) => gl.getShaderInfoLog(s));
    throw new Error([gl.getProgramInfoLog(program), ...logs].filter(Boolean).join('\n'));
  }
  const at = {};
  for (let n = 0; n < gl.getProgramParameter(program, gl.ACTIVE_UNIFORMS); ++n) {
    const name = gl.getActiveUniform(program, n).name;
    at[name] = gl.getUniformLocation(program, name);
  }
  return { program, at };
}

export function texture(gl, target, filter) {
  const made = gl.createTexture();
  gl.bindTexture(target, made);
  for (const wrap of [gl.TEXTURE_WRAP_S, gl.TEXTURE_WRAP_T, gl.TEXTURE_WRAP_R])
    gl.texParameteri(target, wrap, gl.CLAMP_TO_EDGE);
  gl.texParameteri(target, gl.TEXTURE_MIN_FILTER, filter);
  gl.texParameteri(target, gl.TEXTURE_MAG_FILTER, filter);
  return made;
}

/** Texels in rows of 1024: what texelFetch() reads by number. */
export function table(gl, made, internal, format, type, texels, components) {
  const rows = Math.max(1, Math.ceil(texels.length / components / 1024));
  const whole = new texels.constructor(rows * 1024 * components);
  whole.set(texels);
  gl.bindTexture(gl.TEXTURE_2D, made);
  gl.texImage2D(gl.TEXTURE_2D, 0, internal, 1024, rows, 0, format, type, whole);
}

/** What is drawn into; 16 bits a number where the device draws them. */
export class Target {
  constructor(gl) {
    this.gl = gl;
    this.isFloat = !!gl.getExtension('EXT_color_buffer_float') || !!gl.getExtension('EXT_color_buffer_half_float');
    this.frame = gl.createFramebuffer();
  }
  resize(width, height) {
    if (this.width === width && this.height === height) return false;
    const gl = this.gl;
    gl.deleteTexture(this.texture);
    this.width = width, this.height = height;
    this.texture = texture(gl, gl.TEXTURE_2D, gl.LINEAR);
    gl.texStorage2D(gl.TEXTURE_2D, 1, this.isFloat ? gl.RGBA16F : gl.RGBA8, width, height);
    gl.bindFramebuffer(gl.FRAMEBUFFER, this.frame);
    gl.framebufferTexture2D(gl.FRAMEBUFFER, gl.COLOR_ATTACHMENT0, gl.TEXTURE_2D, this.texture, 0);
    return true;
  }
  /** Waits until what was asked for is drawn. */
  wait() {
    const gl = this.gl;
    gl.bindFramebuffer(gl.FRAMEBUFFER, this.frame);
    gl.readPixels(0, 0, 1, 1, gl.RGBA, this.isFloat ? gl.FLOAT : gl.UNSIGNED_BYTE,
      this.isFloat ? new Float32Array(4) : new Uint8Array(4));
  }
}
