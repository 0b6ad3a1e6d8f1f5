'use strict';
// The package as a user gets it: what `npm pack` puts in the tarball, and the tarball installed
// offline into an empty folder (node-gyp builds it there), required and initialised on a private
// desktop.
const test = require('node:test');
const assert = require('node:assert');
const { execFileSync, spawnSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop } = require('../../scripts/desktop');
const { root } = require('./addon');

// npm settings of an enclosing `npm test` must not steer the inner npm runs.
function npmEnv(extra = {}) {
  const env = Object.fromEntries(Object.entries(process.env).filter(([k]) => !/^npm_/i.test(k)));
  return { ...env, JOBS: String(os.cpus().length), ...extra };
}

function npm(args, cwd) {
  const r = spawnSync('npm', args, { cwd, env: npmEnv(), encoding: 'utf8' });
  assert.strictEqual(r.status, 0, `npm ${args.join(' ')}:\n${r.stdout}\n${r.stderr}`);
  return r.stdout;
}

test('the package from its tarball', { timeout: 15 * 60 * 1000 }, async (t) => {
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-package-'));
  t.after(() => fs.rmSync(dir, { recursive: true, force: true }));

  await t.test('the tarball holds the sources, the build files, the install scripts, README and declarations only', () => {
    const [{ files }] = JSON.parse(npm(['pack', '--dry-run', '--json'], root));
    const packed = files.map((f) => f.path).sort();
    const native = execFileSync('git', ['ls-files', 'native'], { cwd: root, encoding: 'utf8' }).trim().split('\n');
    assert.deepStrictEqual(packed, [
      'README.md', 'binding.gyp', 'index.d.ts', 'index.js', ...native, 'package.json', 'scripts/gyp.js', 'scripts/sources.js',
    ].sort());
  });

  await t.test('installed offline into an empty folder, it builds, loads and finds the private desktop', async () => {
    // Offline, the one dependency comes as a tarball too, packed from the copy the repository has.
    const pack = (folder) => path.join(dir, npm(['pack', '--pack-destination', dir, folder], root).trim().split('\n').pop());
    const tarballs = [pack(root), pack(path.join(root, 'node_modules', 'nan'))];
    const host = path.join(dir, 'host');
    fs.mkdirSync(host);
    npm(['install', '--offline', '--no-audit', '--no-fund', ...tarballs], host);
    const installed = path.join(host, 'node_modules', 'tavio_capture');
    assert.ok(fs.existsSync(path.join(installed, 'build', 'Release', 'tavio_capture.node')), 'the install built the add-on');

    const desktop = await startDesktop({
      width: 640, height: 480,
      sinks: [{ name: 'tavio_speakers', description: 'Tavio Speakers', default: true }],
      microphone: { name: 'tavio_mic', description: 'Tavio Microphone', frequency: 440 },
    });
    try {
      const script = `
        const capture = require('tavio_capture');
        const sources = [];
        capture.setCallback((e) => { if (e.type === 'new source') sources.push(e.source); });
        capture.initialize();
        console.log(JSON.stringify({ from: require.resolve('tavio_capture'), sources }));
        process.exit(0);`;
      const r = spawnSync(process.execPath, ['-e', script], { cwd: host, env: { ...npmEnv(desktop.env), TAVIO_TEST_CAMERAS: '' }, encoding: 'utf8', timeout: 60000 });
      assert.strictEqual(r.status, 0, r.stderr);
      const { from, sources } = JSON.parse(r.stdout.trim().split('\n').pop());
      assert.strictEqual(from, path.join(installed, 'index.js'));
      assert.deepStrictEqual(sources.map((s) => [s.type, s.name]), [
        ['mfce_audio', 'Tavio Microphone'], ['wasapi', 'Tavio Speakers'], ['dxgi', 'screen']]);
      assert.deepStrictEqual([sources[2].width, sources[2].height], [640, 480]);
    } finally {
      desktop.stop();
    }
  });
});
