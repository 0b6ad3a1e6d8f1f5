'use strict';
// Displays end to end: a private Xvfb with two RandR monitors, the add-on in a child process,
// a known pattern drawn by test/tools/xpattern.cc (compiled here with g++), the pointer moved
// with xdotool, recordings checked with ffprobe and by decoding them.
const { test, before, after } = require('node:test');
const assert = require('node:assert');
const { spawn, execFileSync, spawnSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop } = require('../../scripts/desktop');
const { runAddon, root } = require('./addon');
const clips = require('./clips');

const MONITORS = ['*LEFT 960/254x1080/286+0+0 screen', 'RIGHT 960/254x1080/286+960+0 none'];
let tools;
let xpattern;

before(() => {
  tools = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-display-'));
  xpattern = path.join(tools, 'xpattern');
  execFileSync('g++', ['-O2', '-o', xpattern, path.join(root, 'test/tools/xpattern.cc'), '-lxcb']);
});
after(() => fs.rmSync(tools, { recursive: true, force: true }));

// Starts xpattern and resolves once it has drawn.
function pattern(env, args) {
  return new Promise((resolve, reject) => {
    const child = spawn(xpattern, args.map(String), { env: { ...process.env, ...env }, stdio: ['ignore', 'pipe', 'pipe'] });
    child.stdout.on('data', (d) => { if (String(d).includes('ready')) resolve(child); });
    child.on('error', reject);
    child.on('exit', (code) => reject(new Error(`xpattern ended (${code})`)));
  });
}

function movePointer(env, x, y) {
  execFileSync('xdotool', ['mousemove', String(x), String(y)], { env: { ...process.env, ...env } });
}

async function withDesktop(fn, xvfbArguments = [], depth = 24) {
  const desktop = await startDesktop({ monitors: MONITORS, xvfbArguments, depth });
  const children = [];
  try {
    await fn(desktop.env, children);
  } finally {
    for (const child of children) child.kill('SIGTERM');
    desktop.stop();
  }
}

// Script prelude: initialize and find the display sources.
const INIT = `
addon.initialize();
const displays = events.filter((e) => e.type === 'new source' && e.source.type === 'dxgi').map((e) => e.source);
const left = displays[0];
async function preview(uid, w, h) {
  for (let i = 0; i < 200; i++) {
    const p = addon.getPreview(uid, w, h);
    if (p) return p;
    await sleep(10);
  }
  return undefined;
}
`;

test('two monitors give two display sources in server order, the first selected', async () => {
  await withDesktop(async (env) => {
    const { reports, code, stderr } = await runAddon(`${INIT} report(displays);`, { env });
    assert.strictEqual(code, 0, stderr);
    const [displays] = reports;
    assert.strictEqual(displays.length, 2);
    assert.deepStrictEqual(displays.map((d) => d.name), ['LEFT', 'RIGHT']);
    assert.deepStrictEqual(displays.map((d) => d.selected), [1, 0]);
    assert.strictEqual(displays[1].id, displays[0].id + 1);
    for (const d of displays) {
      assert.strictEqual(d.width, 960);
      assert.strictEqual(d.height, 1080);
      assert.strictEqual(d.pixelWidth, 4);
      assert.strictEqual(d.size, 960 * 1080 * 4);
    }
  });
});

// Servers with RENDER get the picture composited into shared memory; without it, GetImage, whose
// pixels at depths other than 24 and 32 the grab converts itself.
const SERVERS = [['', []], [', X server without RENDER', ['-extension', 'RENDER']]];
for (const [server, xvfbArguments] of SERVERS) {
  for (const depth of [16, 30]) {
    test(`a screen of depth ${depth} previews the pattern in its true colours${server}`, async () => {
      await withDesktop(async (env, children) => {
        movePointer(env, 1900, 1000);
        children.push(await pattern(env, [0, 0, 960, 1080]));
        const { reports, code, stderr, stdout } = await runAddon(`${INIT}
          const p = await preview(left.id, 96, 108);
          report([12, 36, 60, 84].map((x) => Array.from(p.slice((54 * 96 + x) * 4, (54 * 96 + x) * 4 + 4))));
        `, { env });
        assert.strictEqual(code, 0, stderr + stdout);
        assert.deepStrictEqual(reports[0], [[255, 0, 0, 255], [0, 255, 0, 255], [0, 0, 255, 255], [255, 255, 255, 255]]);
      }, xvfbArguments, depth);
    });
  }
  test(`getPreview returns the scaled pattern in red, green, blue, alpha order${server}`, async () => {
    await withDesktop(async (env, children) => {
      movePointer(env, 1900, 1000);  // on the right monitor, out of the picture
      children.push(await pattern(env, [0, 0, 960, 1080]));
      const { reports, code, stderr } = await runAddon(`${INIT}
        const p = await preview(left.id, 96, 108);
        // Block centres (quarters of 96 columns), row 54.
        report([12, 36, 60, 84].map((x) => Array.from(p.slice((54 * 96 + x) * 4, (54 * 96 + x) * 4 + 4))));
        report(p.length);
        report(addon.getPreview(left.id, 0, 0).length);
      `, { env });
      assert.strictEqual(code, 0, stderr);
      assert.deepStrictEqual(reports[0], [[255, 0, 0, 255], [0, 255, 0, 255], [0, 0, 255, 255], [255, 255, 255, 255]]);
      assert.strictEqual(reports[1], 96 * 108 * 4);
      assert.strictEqual(reports[2], 0);
    }, xvfbArguments);
  });

  test(`a small window changing over a still pattern shows in place, and the rest of the picture stays${server}`, async () => {
    await withDesktop(async (env, children) => {
      movePointer(env, 1900, 1000);
      children.push(await pattern(env, [0, 0, 960, 1080]));
      const { reports, code, stderr } = await runAddon(`${INIT}
        await preview(left.id, 960, 1080);
        const { spawn } = require('child_process');
        // Blocks of 60 columns at rows 400-499 that move 30 times a second, so most grabs fetch only those rows.
        const small = spawn(${JSON.stringify(xpattern)}, ['480', '400', '240', '100', '30'], { stdio: ['ignore', 'pipe', 'ignore'] });
        await new Promise((resolve) => small.stdout.on('data', (d) => { if (String(d).includes('ready')) resolve(); }));
        const at = (p, x, y) => Array.from(p.slice((y * 960 + x) * 4, (y * 960 + x) * 4 + 4));
        const looks = [];
        for (let i = 0; i < 5; i++) {
          await sleep(150);
          const p = addon.getPreview(left.id, 960, 1080);
          looks.push({ inside: [510, 570, 630, 690].map((x) => at(p, x, 450)),
                       outside: [at(p, 100, 450), at(p, 300, 450), at(p, 800, 450), at(p, 600, 50), at(p, 600, 399), at(p, 600, 500), at(p, 600, 1000)] });
        }
        small.kill('SIGTERM');
        await sleep(500);
        const p = addon.getPreview(left.id, 960, 1080);
        report(looks);
        report([510, 690].map((x) => at(p, x, 450)));
      `, { env });
      assert.strictEqual(code, 0, stderr);
      const [red, green, blue, white] = [[255, 0, 0, 255], [0, 255, 0, 255], [0, 0, 255, 255], [255, 255, 255, 255]];
      for (const look of reports[0]) {
        assert.deepStrictEqual(look.outside, [red, green, white, blue, blue, blue, blue]);
        const names = look.inside.map((c) => JSON.stringify(c));
        for (const c of look.inside) assert.ok([red, green, blue, white].some((k) => JSON.stringify(k) === JSON.stringify(c)), names.join());
        assert.strictEqual(new Set(names).size, 4, names.join());
      }
      assert.deepStrictEqual(reports[1], [blue, blue]);
    }, xvfbArguments);
  });
}

test('mouseCapture switches the pointer in and out of the frames', async () => {
  await withDesktop(async (env, children) => {
    children.push(await pattern(env, [0, 0, 960, 1080]));
    movePointer(env, 120, 540);  // inside the red block
    // Counts pixels that are not red around the pointer, after a pointer move made a new frame.
    const { reports, code, stderr, stdout } = await runAddon(`${INIT}
      const { execFileSync } = require('child_process');
      const notRed = (p) => {
        let n = 0;
        for (let y = 500; y < 580; y++) for (let x = 80; x < 160; x++) {
          const i = (y * 960 + x) * 4;
          if (!(p[i] === 255 && p[i + 1] === 0 && p[i + 2] === 0)) n++;
        }
        return n;
      };
      await preview(left.id, 960, 1080);
      const counts = [];
      for (const [enabled, x] of [[1, 121], [0, 122], [5, 121]]) {
        addon.mouseCapture(left.id, enabled);
        execFileSync('xdotool', ['mousemove', String(x), '540']);
        await sleep(300);
        counts.push(notRed(addon.getPreview(left.id, 960, 1080)));
      }
      report(counts);
    `, { env });
    assert.strictEqual(code, 0, stderr + stdout);
    const [[on, off, onAgain]] = reports;
    assert.ok(on > 20, `pointer drawn: ${on} pixels`);
    assert.strictEqual(off, 0);
    assert.ok(onAgain > 20, `pointer drawn again: ${onAgain} pixels`);
  });
});

const probe = (file) => clips.probe(file, 'stream=codec_name,profile,width,height:packet=pts_time', '-select_streams', 'v:0');

// The frame rate the H.264 stream declares in its timing information, as "num/den". ffprobe's
// r_frame_rate is no test of it: for frames at capture times it is guessed from the times of the
// first frames, and a few late grabs on a loaded machine make that guess 60/1.
function declaredFrameRate(file) {
  const r = spawnSync('ffmpeg', ['-v', 'info', '-i', file, '-map', '0:v:0', '-c', 'copy', '-bsf:v', 'trace_headers',
    '-frames:v', '1', '-f', 'null', '-'], { encoding: 'utf8' });
  assert.strictEqual(r.status, 0, r.stderr);
  const field = (name) => Number((r.stderr.match(new RegExp(`\\s${name}\\s+[01]+ = (\\d+)`)) || [])[1]);
  const tick = field('num_units_in_tick');
  const scale = field('time_scale');
  assert.ok(tick > 0 && scale > 0, 'the stream has timing information');
  const gcd = (a, b) => (b ? gcd(b, a % b) : a);
  const g = gcd(scale, 2 * tick);  // a frame lasts two ticks
  return `${scale / g}/${2 * tick / g}`;
}

// Decoder errors of a full decode. The null muxer's complaints about two frames in one 1/30 s
// tick are left out: capture times are variable by design while the stream declares 30/1.
function decodeErrors(file) {
  const lines = clips.decodeErrors(file).split('\n');
  return lines.filter((line) => line && !/non monotonically increasing dts to muxer/.test(line)).join('\n');
}

test('a recording is H.264 Main at the monitor size, 30/1, timed by capture times', async () => {
  await withDesktop(async (env, children) => {
    children.push(await pattern(env, [0, 0, 960, 1080, 30]));
    const file = path.join(tools, 'left.mp4');
    const { reports, code, stderr, stdout } = await runAddon(`${INIT}
      addon.startCapture(left.id, ${JSON.stringify(file)});
      const clip = events.find((e) => e.type === 'new-clip');
      await sleep(3000);
      addon.stopCapture(left.id);
      const stopped = Date.now();
      await sleep(1500);
      report({ clip, stopped });
    `, { env });
    assert.strictEqual(code, 0, stderr + stdout);
    const [{ clip, stopped }] = reports;
    assert.strictEqual(clip.filename, file);
    const info = probe(file);
    const [stream] = info.streams;
    assert.strictEqual(stream.codec_name, 'h264');
    assert.strictEqual(stream.profile, 'Main');
    assert.strictEqual(stream.width, 960);
    assert.strictEqual(stream.height, 1080);
    assert.strictEqual(declaredFrameRate(file), '30/1');
    assert.strictEqual(decodeErrors(file), '', 'decoding');
    // Frame times are capture times: they span the recorded time and never go back.
    const times = info.packets.map((p) => Number(p.pts_time)).sort((a, b) => a - b);
    assert.ok(times.length > 30, `${times.length} frames`);
    const span = times[times.length - 1] - times[0];
    const recorded = (stopped - clip.start) / 1000;
    assert.ok(Math.abs(span - recorded) < 0.5, `span ${span} s, recorded ${recorded} s`);
  });
});

for (const depth of [24, 16, 30]) {
test(`a recording is upright and its colours are the BT.709 limited-range levels it declares (depth ${depth})`, async () => {
  await withDesktop(async (env, children) => {
    movePointer(env, 1900, 1000);
    // The pattern fills the top half only; the bottom half is the black root window.
    children.push(await pattern(env, [0, 0, 960, 540, 30]));
    const file = path.join(tools, 'levels.mp4');
    const { code, stderr, stdout } = await runAddon(`${INIT}
      addon.startCapture(left.id, ${JSON.stringify(file)});
      await sleep(1500);
      addon.stopCapture(left.id);
      await sleep(1500);
    `, { env });
    assert.strictEqual(code, 0, stderr + stdout);
    assert.strictEqual(decodeErrors(file), '', 'decoding');
    const raw = spawnSync('ffmpeg', ['-v', 'error', '-i', file, '-frames:v', '1', '-pix_fmt', 'yuv420p', '-f', 'rawvideo', '-'],
      { maxBuffer: 1 << 24 });
    assert.strictEqual(raw.status, 0, String(raw.stderr));
    const w = 960, h = 1080, yuv = raw.stdout;
    assert.strictEqual(yuv.length, w * h * 3 / 2);
    const at = (x, y) => [yuv[y * w + x], yuv[w * h + (y >> 1) * (w / 2) + (x >> 1)],
      yuv[w * h * 5 / 4 + (y >> 1) * (w / 2) + (x >> 1)]];
    // Block centres at row 270 (from the left, whichever step the pattern is at), then the black half.
    const blocks = [120, 360, 600, 840].map((x) => at(x, 270));
    const levels = { red: [63, 102, 240], green: [173, 42, 26], blue: [32, 240, 118], white: [235, 128, 128] };
    const near = (got, want) => got.every((v, i) => Math.abs(v - want[i]) <= 6);
    const names = blocks.map((b) => Object.keys(levels).find((k) => near(b, levels[k])));
    assert.ok(names.every(Boolean), JSON.stringify(blocks));
    assert.strictEqual(new Set(names).size, 4, names.join());
    // Consecutive blocks follow the pattern's order red, green, blue, white, rotated.
    const order = ['red', 'green', 'blue', 'white'];
    const first = order.indexOf(names[0]);
    assert.deepStrictEqual(names, [0, 1, 2, 3].map((i) => order[(first + i) % 4]));
    for (const x of [120, 480, 840]) assert.ok(near(at(x, 810), [16, 128, 128]), JSON.stringify(at(x, 810)));
  }, [], depth);
});
}

test('a screen the grab cannot read costs only the displays: the other sources are announced', async () => {
  // Indexed colour without RENDER: neither the server nor the grab can turn it into B, G, R, A.
  await withDesktop(async (env) => {
    const { reports, code, stdout } = await runAddon('addon.initialize(); report(events.map((e) => e.source.type));', { env });
    assert.strictEqual(code, 0, stdout);
    assert.deepStrictEqual(reports[0], ['mfce_audio', 'wasapi']);
    assert.match(stdout, /duplicate\(10\): 0x887a0004: Could not get output duplicator from device\./);
  }, ['-extension', 'RENDER'], 8);
});

test('a recording into a missing folder is a warning and the host records again afterwards', async () => {
  await withDesktop(async (env, children) => {
    children.push(await pattern(env, [0, 0, 960, 1080, 30]));
    const bad = path.join(tools, 'missing', 'folder', 'x.mp4');
    const good = path.join(tools, 'after.mp4');
    const { reports, code, stderr, stdout } = await runAddon(`${INIT}
      addon.startCapture(left.id, ${JSON.stringify(bad)});
      await sleep(1000);
      addon.startCapture(left.id, ${JSON.stringify(good)});
      await sleep(2000);
      addon.stopCapture(left.id);
      await sleep(1500);
      report(events.filter((e) => e.type === 'new-clip').length);
    `, { env });
    assert.strictEqual(code, 0, stderr + stdout);
    assert.strictEqual(reports[0], 2);
    assert.match(stdout, /^\d+: Warning: [\s\S]*Could not create sink\./m);
    assert.ok(!fs.existsSync(bad));
    const [stream] = probe(good).streams;
    assert.strictEqual(stream.codec_name, 'h264');
    assert.strictEqual(decodeErrors(good), '');
  });
});
