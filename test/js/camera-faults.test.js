'use strict';
// Cameras that cannot record say why: refused and failing names, a full disk (the clip keeps what
// was written before, and a new clip works once there is room), sizes libx264 cannot take as
// they are, and a test camera whose graph would read a file.
const test = require('node:test');
const assert = require('node:assert');
const { spawnSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { runAddon } = require('./addon');
const { probe, decodeErrors } = require('./clips');
const { startDesktop } = require('../../scripts/desktop');

const CAMERAS = ['Odd One=color=c=red:size=1x1:rate=30', 'Odd Wide=testsrc2=size=33x17:rate=30',
  'Reader=movie=/etc/passwd', 'Plain=testsrc2=size=640x480:rate=30'].join(';');

// The warning lines of a run: "<ms>: Warning: <date>" followed by "\t<file>(<line>): 0x<code>: <text>".
function warnings(stdout) {
  return stdout.split(/\n(?=\d+: Warning: )/).filter((w) => /^\d+: Warning: /.test(w));
}

// A tmpfs of its own (root only); null where none can be mounted.
function mountTmpfs(dir, options) {
  fs.mkdirSync(dir, { recursive: true });
  return spawnSync('mount', ['-t', 'tmpfs', '-o', options, 'tmpfs', dir]).status === 0 ? dir : null;
}

test('camera recording faults', async (t) => {
  const desktop = await startDesktop({ display: false });
  t.after(() => desktop.stop());
  const env = { ...desktop.env, TAVIO_TEST_CAMERAS: CAMERAS };
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-camera-faults-'));
  t.after(() => fs.rmSync(dir, { recursive: true, force: true }));

  await t.test('a graph that reads a file is refused with a warning; odd sizes record at an even size', async () => {
    const files = [path.join(dir, 'one.mp4'), path.join(dir, 'wide.mp4')];
    const { reports, code, stdout } = await runAddon(`
      addon.initialize();
      const cameras = events.filter((e) => e.type === 'new source' && e.source.type === 'mfce_video').map((e) => e.source);
      await sleep(300);
      addon.startCapture(cameras[0].id, ${JSON.stringify(files[0])});
      addon.startCapture(cameras[1].id, ${JSON.stringify(files[1])});
      await sleep(1000);
      addon.stopCapture(cameras[0].id);
      addon.stopCapture(cameras[1].id);
      report(cameras.map((c) => [c.name, c.width, c.height]));
    `, { env });
    assert.strictEqual(code, 0);
    // A 4:2:2 camera has no odd sizes: lavfi crops 33x17 to 32x16 as it makes YUY2; the one-pixel
    // camera, which cannot be made 4:2:2 at all, sends BGRA and is recorded padded to 2x2.
    assert.deepStrictEqual(reports[0], [['Odd One', 1, 1], ['Odd Wide', 32, 16], ['Plain', 640, 480]]);
    const lines = warnings(stdout);
    assert.strictEqual(lines.length, 1, stdout);
    assert.match(lines[0], /\tnative\/platform\/linux\/mfdevices\(\d+\): 0x80070005: Test camera Reader refused: "movie"/);
    assert.match(lines[0], /\(Access is denied\.\)$/);
    for (const [file, size] of [[files[0], [2, 2]], [files[1], [32, 16]]]) {
      const p = probe(file);
      assert.deepStrictEqual([p.streams[0].width, p.streams[0].height], size, file);
      assert.ok(Math.abs(p.format.duration - 1) < 0.1, `${file}: ${p.format.duration} s`);
      assert.strictEqual(decodeErrors(file), '', file);
    }
  });

  await t.test('names that cannot be recorded are warning lines with the system code', async (t2) => {
    const folder = path.join(dir, 'folder.mp4');
    fs.mkdirSync(folder);
    const readOnly = mountTmpfs(path.join(dir, 'ro'), 'ro,size=1m');
    if (readOnly) t2.after(() => spawnSync('umount', [readOnly]));
    const cases = [
      [path.join(dir, 'clip.MP4'), '0xc00d36b4'],
      [path.join(dir, 'missing', 'clip.mp4'), '0x80070003'],
      [folder, '0x80070005'],
      [path.join(dir, `${'a'.repeat(300)}.mp4`), '0x800700ce'],
    ];
    if (readOnly) cases.push([path.join(readOnly, 'clip.mp4'), '0x80070013']);
    const { code, stdout } = await runAddon(`
      addon.initialize();
      const plain = events.find((e) => e.type === 'new source' && e.source.name === 'Plain').source.id;
      for (const file of ${JSON.stringify(cases.map((c) => c[0]))}) {
        addon.startCapture(plain, file);
        addon.stopCapture(plain);
      }
    `, { env });
    assert.strictEqual(code, 0);
    const lines = warnings(stdout).filter((w) => !w.includes('mfdevices'));
    assert.strictEqual(lines.length, cases.length, stdout);
    cases.forEach(([file, hr], i) => {
      assert.ok(lines[i].includes(`\tnative/capture/video/camera/mfce/mfcesource(312): ${hr}: `), lines[i]);
      assert.ok(lines[i].includes(file), lines[i]);
    });
    assert.ok(readOnly, 'a read-only tmpfs could be mounted');
  });

  await t.test('a full disk ends the clip with what it had and a warning; a new clip works once there is room', async (t2) => {
    const small = mountTmpfs(path.join(dir, 'small'), 'size=2m');
    assert.ok(small, 'a 2 MiB tmpfs could be mounted');
    t2.after(() => spawnSync('umount', [small]));
    const full = path.join(small, 'full.mp4');
    const after = path.join(small, 'after.mp4');
    const { code, stdout, reports } = await runAddon(`
      const fs = require('fs');
      addon.initialize();
      const plain = events.find((e) => e.type === 'new source' && e.source.name === 'Plain').source.id;
      addon.startCapture(plain, ${JSON.stringify(full)});
      const started = Date.now();
      while (Date.now() - started < 20000 && fs.statfsSync(${JSON.stringify(small)}).bavail > 0) await sleep(100);
      await sleep(3000);  // the write that finds no room comes with the next fragment
      const size = fs.statSync(${JSON.stringify(full)}).size;
      fs.copyFileSync(${JSON.stringify(full)}, ${JSON.stringify(path.join(dir, 'full-copy.mp4'))});
      fs.unlinkSync(${JSON.stringify(full)});
      // The clip ended at the full disk: the next start needs no stop before it.
      addon.startCapture(plain, ${JSON.stringify(after)});
      await sleep(1000);
      addon.stopCapture(plain);
      report({ size, seconds: (Date.now() - started) / 1000 });
    `, { env });
    assert.strictEqual(code, 0);
    const lines = warnings(stdout).filter((w) => !w.includes('mfdevices'));
    assert.strictEqual(lines.length, 1, stdout);
    assert.match(lines[0], /\tnative\/capture\/video\/camera\/mfce\/capturemanager\(\d+\): 0x80070070: .*\(There is not enough space on the disk\.\)$/);
    const kept = probe(path.join(dir, 'full-copy.mp4'));
    assert.ok(kept.format.duration >= 1, `the full clip keeps ${kept.format.duration} s (${reports[0].size} bytes)`);
    const again = probe(after);
    assert.ok(Math.abs(again.format.duration - 1) < 0.1, `${again.format.duration} s`);
    assert.strictEqual(decodeErrors(after), '');
  });
});
