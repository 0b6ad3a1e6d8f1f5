'use strict';
// A camera that sends H.264: a test camera whose graph is written "h264:<graph>" in
// TAVIO_TEST_CAMERAS encodes its pictures itself (libx264, Main profile, a key frame every second
// and when a recording asks), as an H.264 webcam does. Its preview is decoded; its recordings are
// its own packets, where a YUY2 camera's are the add-on's encoding (Constrained Baseline, a key
// frame every two seconds).
const test = require('node:test');
const assert = require('node:assert');
const { execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { runAddon } = require('./addon');
const { probe, decodeErrors } = require('./clips');
const { startDesktop } = require('../../scripts/desktop');

// A red band across the top 60 rows of a blue 320x240 picture.
const BANNER = 'color=c=blue:size=320x240:rate=30,drawbox=x=0:y=0:w=320:h=60:color=red:t=fill';
const CAMERAS = `H264 Camera=h264:${BANNER};Plain Camera=${BANNER}`;
const ROWS = [2, 30, 57, 63, 120, 237];
const EXPECTED = ROWS.map((y) => (y < 60 ? 'red' : 'blue'));

function colour([r, g, b]) {
  if (r > 200 && g < 50 && b < 50) return 'red';
  if (r < 50 && g < 50 && b > 200) return 'blue';
  return `other ${r},${g},${b}`;
}

// Indices of the packets the file itself marks as key frames (its sync samples): without
// parsing, so that nothing is guessed from the bit stream.
function keyPackets(file) {
  const flags = execFileSync('ffprobe', ['-v', 'error', '-fflags', '+noparse', '-select_streams', 'v:0',
    '-show_entries', 'packet=flags', '-of', 'csv=p=0', file], { encoding: 'utf8' }).trim().split('\n');
  return flags.flatMap((f, i) => (f.startsWith('K') ? [i] : []));
}

// The first or last decoded picture of a file, as the colours at ROWS in its middle column.
function bannerColours(file, select) {
  const raw = execFileSync('ffmpeg', ['-v', 'error', ...select, '-i', file, '-frames:v', '1', '-f', 'rawvideo', '-pix_fmt', 'rgb24', '-']);
  assert.strictEqual(raw.length, 320 * 240 * 3);
  return ROWS.map((y) => colour(Array.from(raw.subarray((y * 320 + 160) * 3, (y * 320 + 160) * 3 + 3))));
}

test('a camera that sends H.264', async (t) => {
  const desktop = await startDesktop({ display: false, microphone: null });
  t.after(() => desktop.stop());
  const env = { ...desktop.env, TAVIO_TEST_CAMERAS: CAMERAS };
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-camera-h264-'));
  t.after(() => fs.rmSync(dir, { recursive: true, force: true }));

  await t.test('is listed as a camera with its picture size', async () => {
    const { reports, code } = await runAddon('addon.initialize(); report(events.map((e) => e.source));', { env });
    assert.strictEqual(code, 0);
    const cameras = reports[0].filter((s) => s.type === 'mfce_video');
    assert.deepStrictEqual(cameras.map((s) => [s.id, s.name, s.selected, s.width, s.height, s.size]), [
      [0, 'H264 Camera', 1, 320, 240, 320 * 240 * 4], [1, 'Plain Camera', 0, 320, 240, 320 * 240 * 4]]);
  });

  await t.test('its preview shows the picture upright and in its colours', async () => {
    const { reports, code } = await runAddon(`
      addon.initialize();
      await sleep(1000);
      const picture = addon.getPreview(0, 320, 240);
      report({ length: picture.length, pixels: ${JSON.stringify(ROWS)}.map((y) => Array.from(picture.slice((y * 320 + 160) * 4, (y * 320 + 160) * 4 + 4))) });
    `, { env });
    assert.strictEqual(code, 0);
    const [{ length, pixels }] = reports;
    assert.strictEqual(length, 320 * 240 * 4);
    assert.deepStrictEqual(pixels.map(colour), EXPECTED);
    assert.ok(pixels.every((p) => p[3] === 255), `alpha ${pixels.map((p) => p[3])}`);
  });

  await t.test('its recording is its own H.264 stream from a key frame, whole and decodable', async () => {
    const own = path.join(dir, 'h264.mp4');
    const encoded = path.join(dir, 'plain.mp4');
    const { reports, code } = await runAddon(`
      addon.initialize();
      await sleep(700);  // not on a key frame of the camera's own: it makes one for the recording
      const started = Date.now();
      addon.startCapture(0, ${JSON.stringify(own)});
      addon.startCapture(1, ${JSON.stringify(encoded)});
      await sleep(4000);
      addon.stopCapture(0);
      addon.stopCapture(1);
      const seconds = (Date.now() - started) / 1000;
      await sleep(2000);  // the files are finished on the engines' threads
      report({ seconds, clips: events.filter((e) => e.type === 'new-clip').map((c) => [c.uid, c.filename]) });
    `, { env });
    assert.strictEqual(code, 0);
    const [{ seconds, clips }] = reports;
    assert.deepStrictEqual(clips, [[0, own], [1, encoded]]);

    const v = probe(own);
    assert.deepStrictEqual(v.streams.map((s) => [s.codec_type, s.codec_name, s.width, s.height]), [['video', 'h264', 320, 240]]);
    assert.ok(v.streams[0].extradata_size > 0, 'the parameter sets are in the file');
    assert.strictEqual(decodeErrors(own), '');
    assert.ok(Math.abs(v.format.duration - seconds) / seconds < 0.05, `video ${v.format.duration} s for ${seconds} s`);
    assert.deepStrictEqual(bannerColours(own, []), EXPECTED, 'first picture');
    assert.deepStrictEqual(bannerColours(own, ['-sseof', '-0.3']), EXPECTED, 'last picture');

    // The camera's own encoding, not the add-on's: the profile and key-frame rhythm of the camera
    // (30 frames), where the same pictures encoded by the add-on have its own (60 frames).
    const keys = keyPackets(own);
    assert.strictEqual(keys[0], 0, 'the file starts at a key frame');
    assert.ok(keys.length >= 4, `key frames at ${keys}`);
    assert.deepStrictEqual(keys, keys.map((_, i) => 30 * i), `key frames at ${keys}`);
    assert.strictEqual(v.streams[0].profile, 'Main');
    const e = probe(encoded);
    assert.strictEqual(decodeErrors(encoded), '');
    assert.strictEqual(e.streams[0].profile, 'Constrained Baseline');
    const encodedKeys = keyPackets(encoded);
    assert.deepStrictEqual(encodedKeys, encodedKeys.map((_, i) => 60 * i), `add-on's key frames at ${encodedKeys}`);
  });
});
