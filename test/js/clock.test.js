'use strict';
// Time that does not run as the host sees it, in the middle of clips: a step of the system clock,
// as a time service, a user or a virtual machine's time sync makes one, and a host held up for
// seconds (stopped, as Ctrl-Z stops it, or starved), while the sink plays on. Every clip still
// lasts from its start to its stop, and stopping returns at once. The host's system clock is moved
// with libfaketime (its monotonic clock is left alone), so the desktop's servers and players keep
// the real time.
const { test, before, after } = require('node:test');
const assert = require('node:assert');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop, startAnimation, playTone } = require('../../scripts/desktop');
const { runAddon } = require('./addon');
const { duration: probe, decodeErrors, decode } = require('./clips');

const FAKETIME = '/usr/lib/x86_64-linux-gnu/faketime/libfaketimeMT.so.1';
const CAMERAS = 'Clock Camera=testsrc2=size=320x240:rate=30';
// Within a frame for pictures, 60 ms for sound (an AAC frame and the endpoint's packet).
const TOLERANCE = { dxgi: 1 / 30 + 0.01, mfce_video: 1 / 30 + 0.02, mfce_audio: 0.06, wasapi: 0.06 };

// Each clip lasts its start to its stop (walls: seconds from the start to each source's stop)
// and decodes cleanly.
function assertClips(walls, file) {
  assert.deepStrictEqual(Object.keys(walls).sort(), ['dxgi', 'mfce_audio', 'mfce_video', 'wasapi']);
  for (const [type, wall] of Object.entries(walls)) {
    const seconds = probe(file(type));
    assert.ok(Math.abs(seconds - wall) <= TOLERANCE[type], `${type}: ${seconds} s for ${wall} s`);
    assert.strictEqual(decodeErrors(file(type)), '', type);
  }
}

// Seconds into a clip of its 50 ms stretches that are silent (RMS below 0.001).
function silences(file) {
  const samples = decode(file);
  const found = [];
  for (let i = 0; i + 2400 <= samples.length; i += 2400) {
    let sum = 0;
    for (let j = i; j < i + 2400; j++) sum += samples[j] * samples[j];
    if (Math.sqrt(sum / 2400) < 0.001) found.push(i / 48000);
  }
  return found;
}

let dir;
let desktop;
let animation;
before(async () => {
  dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-clock-'));
  desktop = await startDesktop();
  animation = startAnimation(desktop.env);
});
after(() => {
  animation.kill();
  desktop.stop();
  fs.rmSync(dir, { recursive: true, force: true });
});

// A host that records every source into `<dir>/<prefix><type>.mp4`, runs `during` one second in,
// and stops each source in turn once `during` has resolved; it reports the seconds from the start
// to each source's stop (by performance.now(): Date.now() may be the stepped clock) and how long
// the stops took, as { walls, stopMs }.
function recordAll(prefix, during) {
  return `
    addon.initialize();
    const sources = events.filter((e) => e.type === 'new source').map((e) => e.source);
    await sleep(1000);
    const started = performance.now();
    for (const s of sources) addon.startCapture(s.id, ${JSON.stringify(`${dir}/${prefix}`)} + s.type + '.mp4');
    await sleep(1000);
    ${during}
    const walls = {};
    const stopping = performance.now();
    for (const s of sources) {
      walls[s.type] = (performance.now() - started) / 1000;
      addon.stopCapture(s.id);
    }
    const stopMs = performance.now() - stopping;
    await sleep(1500);
    report({ walls, stopMs });`;
}

for (const step of ['+30', '-30']) {
  test(`the system clock stepped by ${step} s mid-clip: every clip lasts its start to its stop`, async () => {
    const offsetFile = path.join(dir, `offset${step}`);
    fs.writeFileSync(offsetFile, '+0\n');
    const during = `require('fs').writeFileSync(${JSON.stringify(offsetFile)}, '${step}\\n'); await sleep(1500);`;
    const { reports, code, stdout, stderr } = await runAddon(recordAll(`step${step}-`, during), {
      env: {
        ...desktop.env, TAVIO_TEST_CAMERAS: CAMERAS, LD_PRELOAD: FAKETIME, FAKETIME_TIMESTAMP_FILE: offsetFile,
        FAKETIME_NO_CACHE: '1', FAKETIME_DONT_FAKE_MONOTONIC: '1', FAKETIME_DONT_RESET: '1',
      },
      timeoutMs: 30000,
    });
    assert.strictEqual(code, 0, stdout + stderr);
    const [{ walls, stopMs }] = reports;
    // A microphone that sends two seconds at once is waited for up to half a second; a stop that
    // waits for the system clock to come back takes the whole step.
    assert.ok(stopMs < 1500, `stopping took ${stopMs} ms`);
    assertClips(walls, (type) => path.join(dir, `step${step}-${type}.mp4`));
    assert.doesNotMatch(stdout, /Warning/);
  });
}

test('a host held up for four seconds mid-clip: every clip lasts its start to its stop, the endpoint\'s tone without a gap', async (t) => {
  const tone = playTone(desktop.env, { sink: 'tavio_speakers' });
  t.after(() => tone.kill());
  // Stopped by a shell it starts; the stops come two seconds after it goes on.
  const during = `
    const stopAt = performance.now() + 6000;
    require('child_process').spawn('sh', ['-c', 'kill -STOP ' + process.pid + '; sleep 4; kill -CONT ' + process.pid],
      { stdio: 'ignore', detached: true });
    while (performance.now() < stopAt) await sleep(50);`;
  const { reports, code, stdout, stderr } = await runAddon(recordAll('held-', during),
    { env: { ...desktop.env, TAVIO_TEST_CAMERAS: CAMERAS }, timeoutMs: 30000 });
  assert.strictEqual(code, 0, stdout + stderr);
  const file = (type) => path.join(dir, `held-${type}.mp4`);
  assertClips(reports[0].walls, file);
  // The sink may hold its first sound back a while; from then on the tone plays throughout.
  const quiet = silences(file('wasapi'));
  const first = quiet.findIndex((at, i) => Math.round(at * 20) !== i);
  const gaps = quiet.slice(first < 0 ? quiet.length : first);
  assert.deepStrictEqual(gaps, [], `silent at ${gaps.join(', ')} s`);
  assert.doesNotMatch(stdout, /Warning/);
});
