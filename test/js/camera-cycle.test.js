'use strict';
// Start/stop cycles on cameras and camera microphones: five 1 s clips per source, some started the
// moment the one before stopped. Each clip must be a valid file whose length is the wall-clock
// time from its startCapture to its stopCapture, finished within a second of the stop. The
// microphones are a low-latency one (a remapped null-sink monitor) and the sine source, whose
// sound comes two seconds at a time: its reads must hold up no command.
const test = require('node:test');
const assert = require('node:assert');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { runAddon } = require('./addon');
const { duration, decodeErrors } = require('./clips');
const { startDesktop } = require('../../scripts/desktop');

const CAMERAS = 'YUY2 Camera=testsrc2=size=320x240:rate=30;H264 Camera=h264:testsrc2=size=320x240:rate=30';
const FRAME = 1 / 30;

test('five 1 s clips per camera kind, gaps of 0 ms included', async (t) => {
  const desktop = await startDesktop({
    display: false,
    remappedMicrophone: { name: 'tavio_live', description: 'Tavio Live Microphone', frequency: 880 },
  });
  t.after(() => desktop.stop());
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-camera-cycle-'));
  t.after(() => fs.rmSync(dir, { recursive: true, force: true }));

  // Gaps between a clip's stop and the next one's start, in ms.
  const gaps = [0, 300, 0, 0];
  const { reports, code, stdout } = await runAddon(`
    const { execFileSync } = require('child_process');
    addon.initialize();
    const sources = events.filter((e) => e.type === 'new source').map((e) => e.source);
    const uids = ['YUY2 Camera', 'H264 Camera', 'Tavio Live Microphone', 'Tavio Microphone'].map((name) => sources.find((s) => s.name === name).id);
    await sleep(500);
    const now = () => performance.timeOrigin + performance.now();
    const clips = [];
    const gaps = ${JSON.stringify(gaps)};
    for (let i = 0; i < 5; i++) {
      const round = uids.map((uid) => {
        const file = ${JSON.stringify(dir)} + '/clip-' + uid + '-' + i + '.mp4';
        const start = now();
        addon.startCapture(uid, file);
        return { uid, file, start };
      });
      await sleep(1000);
      for (const clip of round) {
        clip.stop = now();
        addon.stopCapture(clip.uid);
        clips.push(clip);
      }
      if (i < gaps.length && gaps[i]) await sleep(gaps[i]);
    }
    // Within a second of the last stop every file is whole, whatever the devices do next.
    await sleep(1000);
    const probed = clips.map((clip) => {
      try {
        return Number(execFileSync('ffprobe', ['-v', 'error', '-show_entries', 'format=duration', '-of', 'csv=p=0', clip.file],
          { encoding: 'utf8' }).trim());
      } catch (_) {
        return null;
      }
    });
    report({ uids, clips, probed });
  `, { env: { ...desktop.env, TAVIO_TEST_CAMERAS: CAMERAS } });
  assert.strictEqual(code, 0);
  assert.ok(!/Warning:/.test(stdout), stdout);
  const [{ uids, clips, probed }] = reports;
  assert.strictEqual(clips.length, 20);
  // Every clip is checked before anything fails, so one run shows the whole picture.
  const wrong = [];
  clips.forEach((clip, i) => {
    const wall = (clip.stop - clip.start) / 1000;
    const tolerance = clip.uid === uids[2] || clip.uid === uids[3] ? 0.05 : FRAME;
    const file = duration(clip.file);
    const errors = decodeErrors(clip.file);
    if (probed[i] === null || Math.abs(probed[i] - wall) > tolerance || Math.abs(file - wall) > tolerance || errors) {
      wrong.push(`${path.basename(clip.file)}: wall ${wall.toFixed(3)} s, 1 s after the stop ${probed[i]} s, file ${file} s ${errors}`);
    }
  });
  assert.deepStrictEqual(wrong, []);
});
