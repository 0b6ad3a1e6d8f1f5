'use strict';
// A step of the system clock in the middle of clips, as a time service, a user or a virtual
// machine's time sync makes one: every clip still lasts from its start to its stop, and stopping
// returns at once. The host's system clock is moved with libfaketime (its monotonic clock is
// left alone), so the desktop's servers and players keep the real time.
const { test, before, after } = require('node:test');
const assert = require('node:assert');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop, startAnimation } = require('../../scripts/desktop');
const { runAddon } = require('./addon');
const { duration: probe, decodeErrors } = require('./clips');

const FAKETIME = '/usr/lib/x86_64-linux-gnu/faketime/libfaketimeMT.so.1';
const CAMERAS = 'Clock Camera=testsrc2=size=320x240:rate=30';
// Within a frame for pictures, 60 ms for sound (an AAC frame and the endpoint's packet).
const TOLERANCE = { dxgi: 1 / 30 + 0.01, mfce_video: 1 / 30 + 0.02, mfce_audio: 0.06, wasapi: 0.06 };

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

for (const step of ['+30', '-30']) {
  test(`the system clock stepped by ${step} s mid-clip: every clip lasts its start to its stop`, async () => {
    const offsetFile = path.join(dir, `offset${step}`);
    fs.writeFileSync(offsetFile, '+0\n');
    const { reports, code, stdout, stderr } = await runAddon(`
      addon.initialize();
      const sources = events.filter((e) => e.type === 'new source').map((e) => e.source);
      await sleep(1000);
      // Date.now() is the stepped clock; performance.now() runs on.
      const started = performance.now();
      for (const s of sources) addon.startCapture(s.id, ${JSON.stringify(dir)} + '/' + s.type + '${step}.mp4');
      await sleep(1000);
      require('fs').writeFileSync(${JSON.stringify(offsetFile)}, '${step}\\n');
      await sleep(1500);
      const walls = {};
      const stopping = performance.now();
      for (const s of sources) {
        walls[s.type] = (performance.now() - started) / 1000;
        addon.stopCapture(s.id);
      }
      const stopMs = performance.now() - stopping;
      await sleep(1500);
      report({ walls, stopMs });`, {
      env: {
        ...desktop.env, TAVIO_TEST_CAMERAS: CAMERAS, LD_PRELOAD: FAKETIME, FAKETIME_TIMESTAMP_FILE: offsetFile,
        FAKETIME_NO_CACHE: '1', FAKETIME_DONT_FAKE_MONOTONIC: '1', FAKETIME_DONT_RESET: '1',
      },
      timeoutMs: 30000,
    });
    assert.strictEqual(code, 0, stdout + stderr);
    const [{ walls, stopMs }] = reports;
    assert.deepStrictEqual(Object.keys(walls).sort(), ['dxgi', 'mfce_audio', 'mfce_video', 'wasapi']);
    // A microphone that sends two seconds at once is waited for up to half a second; a stop that
    // waits for the system clock to come back takes the whole step.
    assert.ok(stopMs < 1500, `stopping took ${stopMs} ms`);
    for (const [type, wall] of Object.entries(walls)) {
      const file = path.join(dir, `${type}${step}.mp4`);
      const seconds = probe(file);
      assert.ok(Math.abs(seconds - wall) <= TOLERANCE[type], `${type}: ${seconds} s for ${wall} s`);
      assert.strictEqual(decodeErrors(file), '', type);
    }
    assert.doesNotMatch(stdout, /Warning/);
  });
}
