'use strict';
// Cameras and capture-device microphones from JavaScript: lavfi test cameras named in
// TAVIO_TEST_CAMERAS ("Name=lavfi graph;..."), and the virtual desktop's sine-source microphone.
const test = require('node:test');
const assert = require('node:assert');
const { execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { runAddon } = require('./addon');
const { probe, decodeErrors } = require('./clips');
const { startDesktop } = require('../../scripts/desktop');

const CAMERAS = 'Test Camera A=testsrc2=size=640x480:rate=30;Test Camera B=color=c=red:size=1280x720:rate=30';

test('cameras and capture-device microphones', async (t) => {
  const desktop = await startDesktop({ display: false, microphone: { name: 'tavio_mic', description: 'Tavio Microphone', frequency: 440 } });
  t.after(() => desktop.stop());
  const env = { ...desktop.env, TAVIO_TEST_CAMERAS: CAMERAS };
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-camera-'));
  t.after(() => fs.rmSync(dir, { recursive: true, force: true }));

  await t.test('cameras first, then microphones, the first of each selected, with real preview sizes', async () => {
    const { reports, code } = await runAddon('addon.initialize(); report(events.map((e) => e.source));', { env });
    assert.strictEqual(code, 0);
    const sources = reports[0];
    const cameras = sources.filter((s) => s.type === 'mfce_video');
    const microphones = sources.filter((s) => s.type === 'mfce_audio');
    assert.deepStrictEqual(cameras.map((s) => [s.id, s.name, s.selected, s.width, s.height, s.size, s.pixelWidth]), [
      [0, 'Test Camera A', 1, 640, 480, 640 * 480 * 4, 4], [1, 'Test Camera B', 0, 1280, 720, 1280 * 720 * 4, 4]]);
    assert.deepStrictEqual(microphones.map((s) => [s.id, s.name, s.selected]), [[2, 'Tavio Microphone', 1]]);
    assert.deepStrictEqual(Object.keys(microphones[0]), ['id', 'name', 'selected', 'type']);
  });

  await t.test('getPreview shows the camera picture and the microphone tone', async () => {
    const { reports, code } = await runAddon(`
      addon.initialize();
      await sleep(1000);
      const red = addon.getPreview(1, 8, 8);
      const pattern = addon.getPreview(0, 640, 480);
      report({ red: Array.from(red.slice(0, 4)), white: Array.from(pattern.slice((40 * 640 + 40) * 4, (40 * 640 + 40) * 4 + 4)),
               peaks: addon.getPreview(2) });
    `, { env });
    assert.strictEqual(code, 0);
    const [{ red, white, peaks }] = reports;
    assert.ok(red[0] > 240 && red[1] < 20 && red[2] < 20 && red[3] === 255, `red camera shows ${red}`);
    // testsrc2's top-left region is a colour bar; its pixels are fully opaque and not black.
    assert.strictEqual(white[3], 255);
    assert.ok(white[0] + white[1] + white[2] > 100, `testsrc2 shows ${white}`);
    // module-sine-source plays at amplitude 0.5 (its default).
    assert.ok(Math.abs(peaks.left - 0.5) < 0.02 && peaks.right === peaks.left, JSON.stringify(peaks));
  });

  await t.test('startCapture records a camera to H.264 and a microphone to AAC', async () => {
    const video = path.join(dir, 'camera.mp4');
    const audio = path.join(dir, 'microphone.mp4');
    const { reports, code } = await runAddon(`
      addon.initialize();
      await sleep(500);
      const started = Date.now();
      addon.startCapture(0, ${JSON.stringify(video)});
      addon.startCapture(2, ${JSON.stringify(audio)});
      // Not a multiple of two seconds: the test microphone hands over its sound two seconds at a
      // time, so only a cut inside its buffers gives the right length.
      await sleep(3000);
      const seconds = (Date.now() - started) / 1000;
      addon.stopCapture(0);
      addon.stopCapture(2);  // waits until the microphone's sound has reached the stop
      await sleep(3000);  // the files are finished on the engines' threads
      report({ seconds, clips: events.filter((e) => e.type === 'new-clip') });
    `, { env });
    assert.strictEqual(code, 0);
    const [{ seconds, clips }] = reports;
    assert.deepStrictEqual(clips.map((c) => [c.uid, c.filename]), [[0, video], [2, audio]]);
    const v = probe(video);
    assert.deepStrictEqual(v.streams.map((s) => [s.codec_type, s.codec_name, s.width, s.height]), [['video', 'h264', 640, 480]]);
    assert.ok(Math.abs(v.format.duration - seconds) / seconds < 0.05, `video ${v.format.duration} s for ${seconds} s`);
    assert.strictEqual(decodeErrors(video), '');
    const a = probe(audio);
    assert.deepStrictEqual(a.streams.map((s) => [s.codec_type, s.codec_name]), [['audio', 'aac']]);
    assert.strictEqual(decodeErrors(audio), '');
    assert.ok(Math.abs(a.format.duration - seconds) / seconds < 0.05, `audio ${a.format.duration} s for ${seconds} s`);
  });

  await t.test('a microphone that sends seconds at once is not waited for when its sound cannot come in time', async () => {
    // Eight clips, each stopped at another moment of the microphone's two-second lumps: a stop
    // waits for the lump only when it is due within the half-second grace (a quarter of them).
    const { reports, code } = await runAddon(`
      addon.initialize();
      await sleep(2500);
      const clips = [];
      for (let i = 0; i < 8; i++) {
        const file = ${JSON.stringify(dir)} + '/lump' + i + '.mp4';
        const started = Date.now();
        addon.startCapture(2, file);
        await sleep(300 + 97 * i);
        const stopping = Date.now();
        addon.stopCapture(2);
        clips.push({ file, seconds: (stopping - started) / 1000, stopMs: Date.now() - stopping });
      }
      report(clips);
    `, { env });
    assert.strictEqual(code, 0);
    const clips = reports[0];
    const waited = clips.reduce((sum, c) => sum + c.stopMs, 0);
    assert.ok(waited < 2000, `the eight stops took ${waited} ms: ${clips.map((c) => c.stopMs)}`);
    for (const { file, seconds } of clips) {
      assert.strictEqual(decodeErrors(file), '');
      const duration = Number(probe(file).format.duration);
      assert.ok(Math.abs(duration - seconds) < 0.06, `${file}: ${duration} s for ${seconds} s`);
    }
  });

  await t.test('a clip inside the microphone\'s first lump of sound lasts from its start to its stop', async () => {
    // The sound server's first lump can come stamped as if it were captured from its arrival on;
    // a clip that starts inside it must not take the rest of the lump, up to two seconds ahead.
    // Only a new stream's first lump is at stake, and only some come so: a dozen processes, each
    // connecting anew (without the test cameras, which only slow the start).
    for (let run = 0; run < 12; run++) {
      const file = path.join(dir, `first-lump-${run}.mp4`);
      const { code } = await runAddon(`
        addon.initialize();
        const microphone = events.find((e) => e.source.type === 'mfce_audio').source.id;
        await sleep(300);
        addon.startCapture(microphone, ${JSON.stringify(file)});
        addon.stopCapture(microphone);
      `, { env: desktop.env });
      assert.strictEqual(code, 0);
      const duration = Number(probe(file).format.duration);
      assert.ok(duration < 0.06, `run ${run}: ${duration} s for a clip stopped at once`);
    }
  });

  await t.test('the picture is upright in the preview and in the recorded file', async () => {
    // A red band across the top 60 rows of a blue 320x240 picture: an upside-down frame puts it at the bottom.
    const banner = 'Banner=color=c=blue:size=320x240:rate=30,drawbox=x=0:y=0:w=320:h=60:color=red:t=fill';
    const file = path.join(dir, 'banner.mp4');
    const rows = [2, 30, 57, 63, 120, 237];
    const expected = rows.map((y) => (y < 60 ? 'red' : 'blue'));
    const isRed = ([r, g, b]) => r > 200 && g < 50 && b < 50;
    const isBlue = ([r, g, b]) => r < 50 && g < 50 && b > 200;
    const colour = (pixel) => (isRed(pixel) ? 'red' : isBlue(pixel) ? 'blue' : `other ${pixel}`);
    const { reports, code } = await runAddon(`
      addon.initialize();
      await sleep(1000);
      const picture = addon.getPreview(0, 320, 240);
      addon.startCapture(0, ${JSON.stringify(file)});
      await sleep(1500);
      addon.stopCapture(0);
      await sleep(1500);
      report({ length: picture.length, pixels: ${JSON.stringify(rows)}.map((y) => Array.from(picture.slice((y * 320 + 160) * 4, (y * 320 + 160) * 4 + 3))) });
    `, { env: { ...desktop.env, TAVIO_TEST_CAMERAS: banner } });
    assert.strictEqual(code, 0);
    const preview = reports[0];  // RGBA
    assert.strictEqual(preview.length, 320 * 240 * 4);
    assert.deepStrictEqual(preview.pixels.map(colour), expected);

    // First and last decoded frames of the file, as packed RGB rows from the top.
    for (const select of [[], ['-sseof', '-0.3']]) {
      const raw = execFileSync('ffmpeg', ['-v', 'error', ...select, '-i', file, '-frames:v', '1', '-f', 'rawvideo', '-pix_fmt', 'rgb24', '-']);
      assert.strictEqual(raw.length, 320 * 240 * 3);
      assert.deepStrictEqual(rows.map((y) => colour(Array.from(raw.subarray((y * 320 + 160) * 3, (y * 320 + 160) * 3 + 3)))), expected,
        `frame ${select.join(' ') || 'first'}`);
    }
  });

  await t.test('a camera slow to send its first picture, or sending none, holds nothing up and its clip lasts to the stop', async () => {
    // Slow's first picture comes 2 s after the device opens, as from a camera still warming up;
    // Never sends none.
    const cameras = 'Slow=testsrc2=size=320x240:rate=30,realtime,select=gte(t\\,2);' +
      'Never=testsrc2=size=320x240:rate=30,realtime,select=gte(t\\,1000)';
    const files = [path.join(dir, 'slow.mp4'), path.join(dir, 'never.mp4')];
    const { reports, code, stdout } = await runAddon(`
      const started = Date.now();
      addon.initialize();
      const initialized = Date.now() - started;
      const cameras = events.filter((e) => e.type === 'new source' && e.source.type === 'mfce_video').map((e) => e.source);
      const empty = cameras.map((c) => addon.getPreview(c.id, 32, 24) === undefined);
      cameras.forEach((c, i) => addon.startCapture(c.id, ${JSON.stringify(files)}[i]));
      await sleep(3500);
      cameras.forEach((c) => addon.stopCapture(c.id));
      report({ initialized, cameras: cameras.map((c) => [c.name, c.width, c.height]), empty,
               shown: cameras.map((c) => addon.getPreview(c.id, 32, 24) !== undefined) });
    `, { env: { ...env, TAVIO_TEST_CAMERAS: cameras } });
    assert.strictEqual(code, 0);
    assert.ok(!stdout.includes('Warning'), stdout);
    const [{ initialized, ...seen }] = reports;
    // Waiting for a first picture would take 2 s for each time Slow is opened, for ever for Never.
    assert.ok(initialized < 1000, `initialize took ${initialized} ms`);
    assert.deepStrictEqual(seen, { cameras: [['Slow', 320, 240], ['Never', 320, 240]], empty: [true, true], shown: [true, false] });
    for (const file of files) {
      const p = probe(file);
      assert.ok(Math.abs(p.format.duration - 3.5) < 0.1, `${file}: ${p.format.duration} s`);
      assert.strictEqual(decodeErrors(file), '', file);
    }
    // Slow's first picture opens its clip and lasts until the second comes, 1/30 s after it.
    const pts = execFileSync('ffprobe', ['-v', 'error', '-select_streams', 'v', '-show_entries', 'packet=pts_time', '-of', 'csv=p=0', files[0]],
      { encoding: 'utf8' }).trim().split('\n').map(Number).sort((a, b) => a - b);
    assert.strictEqual(pts[0], 0);
    assert.ok(pts[1] > 1.5 && Math.abs(pts[2] - pts[1] - 1 / 30) < 0.002, pts.slice(0, 3).join(', '));
    // Never's clip is black.
    const luma = execFileSync('ffprobe', ['-v', 'error', '-f', 'lavfi', '-i', `movie=${files[1]},signalstats`,
      '-show_entries', 'frame_tags=lavfi.signalstats.YMAX', '-of', 'csv=p=0'], { encoding: 'utf8' }).trim().split('\n').map(Number);
    assert.ok(luma.length > 0 && luma.every((y) => y <= 16), luma.join(', '));
  });

  await t.test('a ".MP4" name records nothing and still sends new-clip', async () => {
    const upper = path.join(dir, 'camera.MP4');
    const { reports, code } = await runAddon(`
      addon.initialize();
      addon.startCapture(1, ${JSON.stringify(upper)});
      await sleep(1000);
      addon.stopCapture(1);
      report(events.filter((e) => e.type === 'new-clip'));
    `, { env });
    assert.strictEqual(code, 0);
    assert.deepStrictEqual(reports[0].map((c) => [c.uid, c.filename]), [[1, upper]]);
    assert.ok(!fs.existsSync(upper));
  });
});
