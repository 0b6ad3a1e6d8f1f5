'use strict';
// Clips as a user records them: each covers its start to its stop whatever the picture or the
// sound does, clips started together line up, start/stop cycles lose nothing, two clips never
// write one file, a host that ends while recording finishes its clips first, and a host killed
// mid-recording leaves files that play up to about a second before the kill, in FFmpeg,
// GStreamer and MediaInfo alike.
const { test, before, after } = require('node:test');
const assert = require('node:assert');
const { execFileSync, spawnSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop, startAnimation } = require('../../scripts/desktop');
const { runAddon, root } = require('./addon');
const { duration: probe, decodeErrors, decode, otherPlayers } = require('./clips');

let dir;
let flashbeep;

before(() => {
  dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-recording-'));
  flashbeep = path.join(dir, 'flashbeep');
  execFileSync('g++', ['-O2', '-o', flashbeep, path.join(root, 'test/tools/flashbeep.cc'), '-lxcb', '-lpulse-simple', '-lpulse']);
});
after(() => fs.rmSync(dir, { recursive: true, force: true }));

async function withDesktop(fn, options = {}) {
  const desktop = await startDesktop(options);
  try {
    await fn(desktop.env);
  } finally {
    desktop.stop();
  }
}


// Seconds into the clip of the first picture whose top-left corner is bright.
function flashTime(file) {
  const r = spawnSync('ffprobe', ['-v', 'error', '-f', 'lavfi', '-i', `movie=${file},crop=64:64:0:0,signalstats`,
    '-show_entries', 'frame=pts_time:frame_tags=lavfi.signalstats.YAVG', '-of', 'csv=p=0'], { encoding: 'utf8' });
  for (const line of r.stdout.trim().split('\n')) {
    const [time, luma] = line.split(',').map(Number);
    if (luma > 128) return time;
  }
  return NaN;
}

// Seconds into the clip of the first sample louder than 0.1.
function beepTime(file) {
  const samples = decode(file);
  const index = samples.findIndex((v) => Math.abs(v) > 0.1);
  return index < 0 ? NaN : index / 48000;
}

const FIND = `
addon.initialize();
const sources = events.filter((e) => e.type === 'new source').map((e) => e.source);
const display = sources.find((s) => s.type === 'dxgi');
const speakers = sources.find((s) => s.type === 'wasapi');
`;

test('a display clip on a still screen covers its start to its stop and is finished at once', async () => {
  await withDesktop(async (env) => {
    const file = path.join(dir, 'still.mp4');
    const { reports, code, stderr } = await runAddon(`${FIND}
      await sleep(1500);  // the screen has been still since initialize
      addon.startCapture(display.id, ${JSON.stringify(file)});
      const start = Date.now();
      await sleep(2000);
      addon.stopCapture(display.id);
      const stop = Date.now();
      const { spawnSync } = require('child_process');
      let validAfter = -1;
      while (Date.now() - stop < 3000) {
        const r = spawnSync('ffprobe', ['-v', 'error', '-show_entries', 'format=duration', '-of', 'csv=p=0', ${JSON.stringify(file)}], { encoding: 'utf8' });
        if (r.status === 0 && Number(r.stdout) > 0) { validAfter = Date.now() - stop; break; }
        await sleep(50);
      }
      report({ wall: (stop - start) / 1000, validAfter });`, { env });
    assert.strictEqual(code, 0, stderr);
    const [{ wall, validAfter }] = reports;
    assert.ok(validAfter >= 0 && validAfter < 1000, `valid ${validAfter} ms after the stop`);
    assert.ok(Math.abs(probe(file) - wall) <= 1 / 30 + 0.01, `${probe(file)} s for ${wall} s`);
    assert.strictEqual(decodeErrors(file), '');
  });
});

test('a flash and a beep made together land at the same time in clips started together', async () => {
  await withDesktop(async (env) => {
    const video = path.join(dir, 'flash.mp4');
    const audio = path.join(dir, 'beep.mp4');
    const { code, stderr } = await runAddon(`${FIND}
      await sleep(1000);
      const { spawn } = require('child_process');
      const tool = spawn(${JSON.stringify(flashbeep)}, ['1500'], { stdio: ['ignore', 'pipe', 'inherit'] });
      await new Promise((resolve) => tool.stdout.on('data', (d) => { if (String(d).includes('ready')) resolve(); }));
      addon.startCapture(display.id, ${JSON.stringify(video)});
      addon.startCapture(speakers.id, ${JSON.stringify(audio)});
      await new Promise((resolve) => tool.stdout.on('data', (d) => { if (String(d).includes('flash')) resolve(); }));
      await sleep(1000);
      addon.stopCapture(display.id);
      addon.stopCapture(speakers.id);
      tool.kill();
      await sleep(1000);`, { env });
    assert.strictEqual(code, 0, stderr);
    const flash = flashTime(video);
    const beep = beepTime(audio);
    assert.ok(flash > 0.5 && beep > 0.5, `flash at ${flash} s, beep at ${beep} s`);
    assert.ok(Math.abs(flash - beep) <= 0.06, `flash at ${flash} s, beep at ${beep} s`);
  });
});

test('back-to-back one-second clips of a display and an endpoint each last their own second', async () => {
  await withDesktop(async (env) => {
    const { reports, code, stderr } = await runAddon(`${FIND}
      const path = require('path');
      const walls = [];
      for (let i = 0; i < 5; i++) {
        const started = Date.now();
        addon.startCapture(display.id, path.join(${JSON.stringify(dir)}, 'cycle-display-' + i + '.mp4'));
        addon.startCapture(speakers.id, path.join(${JSON.stringify(dir)}, 'cycle-endpoint-' + i + '.mp4'));
        await sleep(1000);
        addon.stopCapture(display.id);
        addon.stopCapture(speakers.id);
        walls.push((Date.now() - started) / 1000);
        if (i % 2 === 0) await sleep(300);  // after odd clips the next starts with no gap at all
      }
      await sleep(1500);
      report(walls);`, { env });
    assert.strictEqual(code, 0, stderr);
    const [walls] = reports;
    for (let i = 0; i < 5; i++) {
      for (const [kind, tolerance] of [['display', 1 / 30 + 0.01], ['endpoint', 0.05]]) {
        const file = path.join(dir, `cycle-${kind}-${i}.mp4`);
        const duration = probe(file);
        assert.ok(Math.abs(duration - walls[i]) <= tolerance, `${kind} clip ${i}: ${duration} s for ${walls[i]} s`);
        assert.strictEqual(decodeErrors(file), '', `${kind} clip ${i}`);
      }
    }
  });
});

test('a start on a source that still records ends its clip there and begins the next, on every source', async () => {
  await withDesktop(async (env) => {
    const { reports, code, stderr } = await runAddon(`${FIND}
      const path = require('path');
      const clips = [];
      for (const s of sources) {
        const file = (n) => path.join(${JSON.stringify(dir)}, 'again-' + s.type + '-' + s.id + '-' + n + '.mp4');
        addon.startCapture(s.id, file(0));
        const first = events[events.length - 1].start;
        await sleep(800);
        const second = Date.now();
        addon.startCapture(s.id, file(1));
        const started = events[events.length - 1].start;  // after the first clip was finished
        await sleep(800);
        const stopped = Date.now();
        addon.stopCapture(s.id);
        clips.push({ type: s.type, file: file(0), seconds: (second - first) / 1000 },
          { type: s.type, file: file(1), seconds: (stopped - started) / 1000 });
      }
      report(clips);`, { env: { ...env, TAVIO_TEST_CAMERAS: 'Again Camera=testsrc2=size=320x240:rate=30' } });
    assert.strictEqual(code, 0, stderr);
    const clips = reports[0];
    assert.deepStrictEqual([...new Set(clips.map((c) => c.type))].sort(), ['dxgi', 'mfce_audio', 'mfce_video', 'wasapi']);
    for (const { type, file, seconds } of clips) {
      const tolerance = type === 'dxgi' || type === 'mfce_video' ? 1 / 30 + 0.01 : 0.06;
      const duration = probe(file);
      assert.ok(Math.abs(duration - seconds) <= tolerance, `${path.basename(file)}: ${duration} s for ${seconds} s`);
      assert.strictEqual(decodeErrors(file), '', path.basename(file));
    }
  });
});

test('a clip started under the name of one still being written is a warning line, and the first stays whole', async () => {
  await withDesktop(async (env) => {
    const file = path.join(dir, 'one-name.mp4');
    const { reports, code, stdout, stderr } = await runAddon(`${FIND}
      addon.startCapture(speakers.id, ${JSON.stringify(file)});
      const start = Date.now();
      addon.startCapture(display.id, ${JSON.stringify(file)});
      await sleep(1000);
      addon.stopCapture(speakers.id);
      report((Date.now() - start) / 1000);
      addon.stopCapture(display.id);
      await sleep(300);`, { env });
    assert.strictEqual(code, 0, stderr);
    assert.match(stdout, /0x80070020: .*\(The process cannot access the file because it is being used by another process\.\)/);
    assert.ok(Math.abs(probe(file) - reports[0]) <= 0.06, `${probe(file)} s for ${reports[0]} s`);
    assert.strictEqual(decodeErrors(file), '');
  });
});

test('an endpoint clip started right after initialize lasts its wall time', async () => {
  await withDesktop(async (env) => {
    const file = path.join(dir, 'early.mp4');
    const { reports, code, stderr } = await runAddon(`${FIND}
      addon.startCapture(speakers.id, ${JSON.stringify(file)});
      const start = Date.now();
      await sleep(2000);
      addon.stopCapture(speakers.id);
      report((Date.now() - start) / 1000);
      await sleep(800);`, { env });
    assert.strictEqual(code, 0, stderr);
    const [wall] = reports;
    assert.ok(Math.abs(probe(file) - wall) <= 0.05, `${probe(file)} s for ${wall} s`);
  }, { display: false });
});

test('a host that ends while recording (process.exit, an uncaught exception, a signal) finishes every clip first', async () => {
  await withDesktop(async (env) => {
    // 'SIGINT, handled': the host's own listener decides, and it records on until it exits.
    for (const how of ['exit', 'throw', 'SIGINT', 'SIGTERM', 'SIGINT, handled']) {
      const { reports, code, signal } = await runAddon(`${FIND}
        const path = require('path');
        const how = ${JSON.stringify(how)};
        await sleep(500);
        const clips = sources.map((s) => ({ type: s.type, file: path.join(${JSON.stringify(dir)}, how.replace(/\\W+/g, '-') + '-' + s.type + '-' + s.id + '.mp4') }));
        clips.forEach((c, i) => addon.startCapture(sources[i].id, c.file));
        const start = Date.now();
        const end = () => report({ clips, seconds: (Date.now() - start) / 1000 });
        if (how === 'SIGINT, handled') process.once('SIGINT', () => setTimeout(() => { end(); process.exit(0); }, 1000));
        await sleep(2000);
        if (how !== 'SIGINT, handled') end();
        if (how === 'exit') process.exit(0);
        if (how === 'throw') setTimeout(() => { throw new Error('a host that fails'); });
        else process.kill(process.pid, how.split(',')[0]);
        await sleep(5000);`, { env: { ...env, TAVIO_TEST_CAMERAS: 'Exit Camera=testsrc2=size=320x240:rate=1' } });
      // The process still ends as it would have without the add-on.
      assert.deepStrictEqual({ code, signal }, { exit: { code: 0, signal: null }, throw: { code: 1, signal: null },
        SIGINT: { code: null, signal: 'SIGINT' }, SIGTERM: { code: null, signal: 'SIGTERM' },
        'SIGINT, handled': { code: 0, signal: null } }[how], how);
      const { clips, seconds } = reports[0];
      assert.deepStrictEqual([...new Set(clips.map((c) => c.type))].sort(), ['dxgi', 'mfce_audio', 'mfce_video', 'wasapi']);
      // Every clip ends at the same moment, also those after a camera whose stop waits for its next
      // picture (one a second here, waited for up to a quarter of a second).
      const durations = clips.map((c) => probe(c.file));
      assert.ok(Math.max(...durations) - Math.min(...durations) <= 0.12, `${how}: ${durations.join(' s, ')} s`);
      for (const { type, file } of clips) {
        // Up to the moment the host ended; before, the last unfinished piece of every file was lost.
        const duration = probe(file);
        const tolerance = type === 'dxgi' || type === 'mfce_video' ? 1 / 30 + 0.01 : 0.06;
        assert.ok(duration >= seconds - tolerance && duration <= seconds + 0.5, `${how}, ${path.basename(file)}: ${duration} s for ${seconds} s`);
        assert.strictEqual(decodeErrors(file), '', path.basename(file));
      }
    }
  });
});

test('a host killed while recording leaves files that play up to a second before the kill', async () => {
  await withDesktop(async (env) => {
    const files = { display: path.join(dir, 'kill-display.mp4'), endpoint: path.join(dir, 'kill-endpoint.mp4'),
      camera: path.join(dir, 'kill-camera.mp4'), h264: path.join(dir, 'kill-h264.mp4') };
    const { reports, signal } = await runAddon(`${FIND}
      const cameras = sources.filter((s) => s.type === 'mfce_video');
      await sleep(500);
      addon.startCapture(display.id, ${JSON.stringify(files.display)});
      addon.startCapture(speakers.id, ${JSON.stringify(files.endpoint)});
      addon.startCapture(cameras[0].id, ${JSON.stringify(files.camera)});
      addon.startCapture(cameras[1].id, ${JSON.stringify(files.h264)});
      const start = Date.now();
      await sleep(5000);
      report((Date.now() - start) / 1000);
      process.kill(process.pid, 'SIGKILL');`, {
      env: { ...env, TAVIO_TEST_CAMERAS: 'Kill Camera=testsrc2=size=320x240:rate=30;Kill H264=h264:testsrc2=size=320x240:rate=30' },
    });
    assert.strictEqual(signal, 'SIGKILL');
    const [recorded] = reports;
    for (const [kind, file] of Object.entries(files)) {
      assert.strictEqual(decodeErrors(file), '', kind);
      const duration = probe(file);
      assert.ok(duration >= recorded - 1, `${kind}: ${duration} s of ${recorded} s`);
      // The header's duration, kept up to date at every fragment, is what these two read.
      const others = otherPlayers(file);
      assert.ok(others.played, `${kind}: GStreamer plays it to the end`);
      assert.ok(Math.abs(others.gstreamer - duration) < 0.1, `${kind}: GStreamer ${others.gstreamer} s, FFmpeg ${duration} s`);
      assert.ok(Math.abs(others.mediainfo - duration) < 0.1, `${kind}: MediaInfo ${others.mediainfo} s, FFmpeg ${duration} s`);
    }
  });
});

test('a host recording clip after clip keeps its memory, threads and open files', async () => {
  await withDesktop(async (env) => {
    const animation = startAnimation(env);
    const { reports, code, stdout, stderr } = await runAddon(`${FIND}
      const fs = require('fs');
      const path = require('path');
      const usage = () => ({
        rss: Number(/VmRSS:\\s+(\\d+)/.exec(fs.readFileSync('/proc/self/status', 'utf8'))[1]) / 1024,
        threads: fs.readdirSync('/proc/self/task').length,
        files: fs.readdirSync('/proc/self/fd').length,
      });
      // A display's clip is finished after its stop returns: counted once nothing changes for a moment.
      const settled = async () => {
        let last = usage();
        for (let t = 0; t < 20; t++) {
          await sleep(250);
          const now = usage();
          if (now.threads === last.threads && now.files === last.files) return now;
          last = now;
        }
        return last;
      };
      const seen = [];
      for (let i = 0; i < 40; i++) {
        // A name of its own per clip, for the same reason.
        sources.forEach((s) => addon.startCapture(s.id, path.join(${JSON.stringify(dir)}, 'cycle-' + s.id + '-' + i + '.mp4')));
        await sleep(300);
        for (const s of sources) addon.stopCapture(s.id);
        if (i === 4 || i === 39) seen.push(await settled());
      }
      report(seen);`, { env: { ...env, TAVIO_TEST_CAMERAS: 'Cycle Camera=testsrc2=size=1280x720:rate=30' }, timeoutMs: 120000 });
    animation.kill();
    assert.strictEqual(code, 0, stderr);
    assert.ok(!/Warning:/.test(stdout), stdout);
    const [early, late] = reports[0];
    // A leak grows round by round; a slow host may still be ending the early rounds' encoders when
    // it counts them, so fewer at the end is no fault.
    const counts = `${early.threads} threads and ${early.files} files after 5 rounds, ${late.threads} and ${late.files} after 40`;
    assert.ok(late.threads <= early.threads && late.files <= early.files, counts);
    assert.ok(late.rss - early.rss <= 100, `${early.rss.toFixed(0)} MB after 5 rounds of clips, ${late.rss.toFixed(0)} MB after 40`);
  });
});
