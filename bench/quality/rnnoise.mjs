// RNNoise (the npm WebAssembly build) over planar float32 channels in the 16-bit range.
// Usage: node rnnoise.mjs IN.f32 OUT.f32 CHANNELS   (module path in $RNNOISE_MODULE)
import { readFileSync, writeFileSync } from "node:fs";
import { pathToFileURL } from "node:url";

// The build only runs where it believes it is in a browser.
globalThis.window = globalThis;
const { Rnnoise } = await import(pathToFileURL(process.env.RNNOISE_MODULE).href);
const [input, output, channelArg] = process.argv.slice(2);
const channels = Number(channelArg);
const raw = readFileSync(input);
const all = new Float32Array(raw.buffer, raw.byteOffset, raw.byteLength / 4);
const length = all.length / channels;
const rnnoise = await Rnnoise.load();
const out = new Float32Array(all.length);
for (let c = 0; c < channels; c++) {
  const state = rnnoise.createDenoiseState();
  const frame = new Float32Array(rnnoise.frameSize);
  for (let at = 0; at + frame.length <= length; at += frame.length) {
    frame.set(all.subarray(c * length + at, c * length + at + frame.length));
    state.processFrame(frame);
    out.set(frame, c * length + at);
  }
  state.destroy();
}
writeFileSync(output, Buffer.from(out.buffer));
