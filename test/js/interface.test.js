'use strict';
// The add-on's seven functions, argument rules and events, from JavaScript.
const test = require('node:test');
const assert = require('node:assert');
const { runAddon, root } = require('./addon');
const { execFileSync } = require('child_process');
const { startDesktop, startAnimation } = require('../../scripts/desktop');

const WARNING = /^\d{13}: Warning: (.*)$/;
const warnings = (stdout) => stdout.split('\n').map((l) => l.match(WARNING)).filter(Boolean).map((m) => m[1]);

test('exports the seven functions in order', async () => {
  const { reports, code } = await runAddon('report(Object.keys(addon)); report(typeof addon.initialize);');
  assert.strictEqual(code, 0);
  assert.deepStrictEqual(reports[0], ['initialize', 'getPreview', 'transfer', 'setCallback', 'startCapture',
    'stopCapture', 'mouseCapture']);
  assert.strictEqual(reports[1], 'function');
});

test('loading listens for exit and the ending signals, but leaves the signals to Electron, which quits on its own', () => {
  const listeners = (prelude) => JSON.parse(execFileSync(process.execPath, ['-e', `${prelude}; require(${JSON.stringify(root)});
    console.log(JSON.stringify(['exit', 'SIGINT', 'SIGTERM', 'SIGHUP'].map((e) => process.listenerCount(e))));`],
  { encoding: 'utf8' }));
  assert.deepStrictEqual(listeners(''), [1, 1, 1, 1]);
  assert.deepStrictEqual(listeners("Object.defineProperty(process.versions, 'electron', { value: '30.0.0' })"), [1, 0, 0, 0]);
});

test('FFmpeg\'s log never reaches standard error; its errors are warning lines', async (t) => {
  const desktop = await startDesktop({ width: 640, height: 480 });
  t.after(() => desktop.stop());
  const cameras = 'Plain=testsrc2=size=320x240:rate=30;Encoding=h264:testsrc2=size=320x240:rate=30;' +
    'Broken=testsrc2=size=notasize';
  const folder = require('fs').mkdtempSync(require('path').join(require('os').tmpdir(), 'tavio-log-'));
  t.after(() => require('fs').rmSync(folder, { recursive: true, force: true }));
  // Every source kind previews and records for a second.
  const { reports, stdout, stderr, code } = await runAddon(`
    addon.initialize();
    await sleep(1000);
    const uids = events.filter((e) => e.source.name !== 'Broken').map((e) => e.source.id);
    for (const uid of uids) addon.startCapture(uid, ${JSON.stringify(folder)} + '/' + uid + '.mp4');
    await sleep(1000);
    for (const uid of uids) addon.stopCapture(uid);
    await sleep(1000);
    report(events.filter((e) => e.type === 'new source').map((e) => e.source.type));`, { env: { ...desktop.env, TAVIO_TEST_CAMERAS: cameras } });
  assert.strictEqual(code, 0, stdout + stderr);
  assert.strictEqual(stderr, '');
  assert.match(stdout, /\tnative\/platform\/linux\/avlog\(46\): 0x80004005: FFmpeg lavfi: Error initializing filter 'testsrc2' with args 'size=notasize' \(Unspecified error\)/);
  // Cameras (the broken one left out), the microphone, the endpoint and the display all recorded.
  assert.deepStrictEqual(reports[0], ['mfce_video', 'mfce_video', 'mfce_video', 'mfce_audio', 'wasapi', 'dxgi']);
  assert.strictEqual(require('fs').readdirSync(folder).length, 5);
});

test('setCallback without a function ends the process', async () => {
  const { code, signal, stderr } = await runAddon('addon.setCallback(42); report("survived");');
  assert.ok(code !== 0 || signal, 'the process must not go on');
  assert.match(stderr, /Empty MaybeLocal/);
});

test('with a desktop', async (t) => {
  const desktop = await startDesktop();
  t.after(() => desktop.stop());
  const env = desktop.env;

  await t.test('initialize announces every source synchronously, in uid order, with ordered keys', async () => {
    const { reports, code } = await runAddon(`
      addon.initialize();
      report(events);`, { env });
    assert.strictEqual(code, 0);
    const events = reports[0];
    events.forEach((event, i) => {
      assert.deepStrictEqual(Object.keys(event), ['type', 'source']);
      assert.strictEqual(event.type, 'new source');
      const s = event.source;
      assert.strictEqual(s.id, i);
      assert.ok(s.selected === 0 || s.selected === 1);
      const video = s.type === 'dxgi' || s.type === 'mfce_video';
      assert.deepStrictEqual(Object.keys(s), ['id', 'name', 'selected', 'type',
        ...(video ? ['pixelWidth', 'width', 'height', 'size'] : [])]);
      if (video) assert.strictEqual(s.size, s.pixelWidth * s.width * s.height);
    });
    // Cameras, then camera microphones, then endpoints, then displays.
    const order = ['mfce_video', 'mfce_audio', 'wasapi', 'dxgi'];
    const ranks = events.map((e) => order.indexOf(e.source.type));
    assert.deepStrictEqual(ranks, [...ranks].sort((a, b) => a - b));
  });

  await t.test('clips: no name sends nothing, a bad uid warns and still sends new-clip', async () => {
    const { reports, stdout, code } = await runAddon(`
      addon.initialize();
      const count = events.length;
      addon.startCapture(0);
      addon.startCapture(0, 42);
      addon.startCapture(0, '');
      report(events.length - count);
      const before = Date.now();
      addon.startCapture(999, '/tmp/never-written.mp4');
      const after = Date.now();
      report({ clip: events[events.length - 1], before, after, delivered: events.length - count });
      addon.stopCapture(999);
      addon.mouseCapture(999, 1);
      addon.stopCapture(-1);`, { env });
    assert.strictEqual(code, 0);
    assert.strictEqual(reports[0], 0);
    const { clip, before, after, delivered } = reports[1];
    assert.strictEqual(delivered, 1);
    assert.deepStrictEqual(Object.keys(clip), ['type', 'uid', 'filename', 'start']);
    assert.strictEqual(clip.type, 'new-clip');
    assert.strictEqual(clip.uid, 999);
    assert.strictEqual(clip.filename, '/tmp/never-written.mp4');
    assert.ok(clip.start >= before && clip.start <= after, `${clip.start} not in [${before}, ${after}]`);
    assert.deepStrictEqual(warnings(stdout), Array(4).fill('invalid vector<T> subscript'));
  });

  await t.test('a uid that is not a 32-bit integer counts as 0', async () => {
    const { reports, code } = await runAddon(`
      addon.initialize();
      const sources = events.length;
      addon.startCapture('2', '/nonexistent-folder/a.mp4');
      addon.startCapture(2.5, '/nonexistent-folder/b.mp4');
      addon.startCapture(2 ** 40, '/nonexistent-folder/c.mp4');
      report({ sources, uids: events.slice(sources).map((e) => e.uid) });
      for (let i = 0; i < sources; i++) addon.stopCapture(i);`, { env });
    assert.strictEqual(code, 0);
    assert.deepStrictEqual(reports[0].uids, [0, 0, 0]);
  });

  await t.test('previews too large to address are refused with a warning and the host lives on', async () => {
    const { reports, stdout, code, signal } = await runAddon(`
      addon.initialize();
      const uid = events.find((e) => e.source.type === 'dxgi').source.id;
      for (let i = 0; i < 200 && !addon.getPreview(uid, 4, 4); i++) await sleep(10);
      report([addon.getPreview(uid, 23171, 23171), addon.getPreview(uid, 100000, 100000),
              addon.getPreview(uid, 65536, 8192), addon.getPreview(uid, 64, 32).length]);`, { env });
    assert.strictEqual(signal, null);
    assert.strictEqual(code, 0, stdout);
    // JSON turns undefined into null.
    assert.deepStrictEqual(reports[0], [null, null, null, 64 * 32 * 4]);
    const refused = (w, h) => `native/interface(175): 0x80070057: getPreview: a preview of ${w}x${h} pixels is ` +
      'larger than 2147483647 bytes. (The parameter is incorrect.)';
    const lines = stdout.split('\n').filter((l) => l.startsWith('\t')).map((l) => l.slice(1));
    assert.deepStrictEqual(lines, [refused(23171, 23171), refused(100000, 100000), refused(65536, 8192)]);
  });

  await t.test('initialize without a callback warns and finds nothing; after setCallback it works', async () => {
    const { reports, stdout, code, signal } = await runAddon(`
      addon.initialize();
      const seen = [];
      addon.setCallback((event) => seen.push(event));
      addon.initialize();
      report(seen.map((e) => e.source.id));`, { env, callback: false });
    assert.strictEqual(signal, null);
    assert.strictEqual(code, 0, stdout);
    // The second call's uids start at 0: the first one added no sources.
    assert.ok(reports[0].length >= 2, JSON.stringify(reports[0]));
    assert.deepStrictEqual(reports[0], reports[0].map((_, i) => i));
    assert.match(stdout, /^\d{13}: Warning: .*\n\tnative\/interface\(52\): 0x80004003: initialize: no event callback; call setCallback first\. \(Invalid pointer\)$/);
  });

  await t.test('transfer answers 1 for the null window and an existing one, 0 for one that does not exist', async () => {
    const animation = startAnimation(env);
    t.after(() => animation.kill());
    let window = 0;
    for (let i = 0; i < 50 && !window; i++) {
      try {
        window = Number(execFileSync('xdotool', ['search', '--name', 'tavio animation'],
          { env: { ...process.env, ...env }, encoding: 'utf8' }).split('\n')[0]);
      } catch (_) {
        await new Promise((resolve) => setTimeout(resolve, 100));
      }
    }
    assert.ok(window > 0, 'the animation window must exist');
    const { reports, code } = await runAddon(`
      report([addon.transfer(0), addon.transfer(), addon.transfer(0x7ffffff0), addon.transfer('x'),
              addon.transfer(${window})]);`, { env });
    assert.strictEqual(code, 0);
    assert.deepStrictEqual(reports[0], [1, 1, 0, 1, 1]);
  });
});
