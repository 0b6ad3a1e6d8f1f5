'use strict';
// What the studio page costs the add-on's process: a 1920x1080 display changing at 60 Hz
// (test/tools/xpattern.cc) and a 1280x720 30 fps test camera, served by examples/studio, with
// the page open in headless Chromium previewing both at 30 per second at 640x360, against the
// same sources with no page, before and after, in the same run. Prints the add-on process's CPU
// in each window (and the web server's), the difference in cores, and the previews per second
// the page drew per source. Targets: at most 0.3 of a core added, at least 28 previews per
// second per source.
//   node bench/studio.js [seconds]
const { spawn, execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const puppeteer = require('puppeteer-core');
const { startDesktop } = require('../scripts/desktop');

const root = path.resolve(__dirname, '..');
const seconds = Number(process.argv[2] || 15);
const ticks = Number(execFileSync('getconf', ['CLK_TCK'], { encoding: 'utf8' }));
const sleep = (ms) => new Promise((resolve) => setTimeout(resolve, ms));

// CPU seconds (user + system) of a process, all its threads.
function cpu(pid) {
  const stat = fs.readFileSync(`/proc/${pid}/stat`, 'utf8');
  const fields = stat.slice(stat.lastIndexOf(')') + 2).split(' ');
  return (Number(fields[11]) + Number(fields[12])) / ticks;
}

// A process and all its descendants (Chromium's browser, renderer, GPU and utility processes).
function tree(pid) {
  const children = new Map();
  for (const entry of fs.readdirSync('/proc').filter((e) => /^\d+$/.test(e))) {
    try {
      const stat = fs.readFileSync(`/proc/${entry}/stat`, 'utf8');
      const parent = Number(stat.slice(stat.lastIndexOf(')') + 2).split(' ')[1]);
      if (!children.has(parent)) children.set(parent, []);
      children.get(parent).push(Number(entry));
    } catch (_) { /* gone meanwhile */ }
  }
  const all = [pid];
  for (let i = 0; i < all.length; i++) all.push(...(children.get(all[i]) || []));
  return all;
}

// CPU seconds of a process tree by Chromium process type (--type=renderer, gpu-process, ...).
function treeCpu(pid) {
  const byType = {};
  for (const p of tree(pid)) {
    try {
      const type = (fs.readFileSync(`/proc/${p}/cmdline`, 'utf8').match(/--type=([\w-]+)/) || [null, 'browser'])[1];
      byType[type] = (byType[type] || 0) + cpu(p);
    } catch (_) { /* gone meanwhile */ }
  }
  return byType;
}

// CPU of each process over one window, in cores.
async function measure(pids, during = () => null) {
  const before = pids.map(cpu);
  const start = performance.now();
  const extra = await during();
  await sleep(seconds * 1000);
  const extraAfter = await during();
  const time = (performance.now() - start) / 1000;
  return { cores: pids.map((pid, i) => (cpu(pid) - before[i]) / time), time, extra, extraAfter };
}

function startStudio(env, folder) {
  const server = spawn(process.execPath, [path.join(root, 'examples', 'studio', 'server.js'), '0', folder],
    { env: { ...process.env, ...env }, stdio: ['ignore', 'pipe', 'inherit'] });
  return new Promise((resolve, reject) => {
    let text = '';
    server.stdout.on('data', (d) => {
      text += d;
      const url = text.match(/open (http:\/\/127\.0\.0\.1:\d+\/)/);
      if (url) resolve({ server, url: url[1], engine: Number(text.match(/add-on process (\d+)/)[1]) });
    });
    server.on('exit', (code) => reject(new Error(`studio ended (${code}): ${text}`)));
  });
}

async function main() {
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-bench-studio-'));
  const xpattern = path.join(dir, 'xpattern');
  execFileSync('g++', ['-O2', '-o', xpattern, path.join(root, 'test/tools/xpattern.cc'), '-lxcb']);
  const desktop = await startDesktop({ width: 1920, height: 1080, microphone: null });
  const animation = spawn(xpattern, ['0', '0', '1920', '1080', '60'], { env: { ...process.env, ...desktop.env }, stdio: 'ignore' });
  let studio = null;
  let browser = null;
  try {
    studio = await startStudio({ ...desktop.env, TAVIO_TEST_CAMERAS: 'Bench Camera=testsrc2=size=1280x720:rate=30' }, dir);
    const pids = [studio.engine, studio.server.pid];
    await sleep(3000);  // devices opened, capture running
    const before = await measure(pids);

    // Without puppeteer's network events: they would copy every WebSocket picture to this process.
    browser = await puppeteer.launch({
      executablePath: '/usr/bin/chromium', headless: true, networkEnabled: false, args: ['--no-sandbox', '--mute-audio'],
    });
    const page = await browser.newPage();
    await page.setViewport({ width: 1600, height: 1000 });
    await page.goto(`${studio.url}?rate=30&width=640`);
    await page.waitForFunction(() => Object.keys(window.studio.drawn).length === 2 &&
      Object.values(window.studio.drawn).every((n) => n > 30), { timeout: 30000 });
    const sizes = await page.$$eval('canvas', (cs) => cs.map((c) => `${c.width}x${c.height}`));
    const names = Object.fromEntries(await page.evaluate(() => window.studio.sources.map((s) => [s.id, s.name])));
    const drawn = () => page.evaluate(() => ({ ...window.studio.drawn }));
    const chromium = browser.process().pid;
    const chromiumBefore = treeCpu(chromium);
    const open = await measure(pids, drawn);
    const chromiumAfter = treeCpu(chromium);
    const chromiumCores = Object.fromEntries(Object.keys(chromiumAfter)
      .map((type) => [type, (chromiumAfter[type] - (chromiumBefore[type] || 0)) / open.time]));
    await page.close();
    await sleep(2000);
    const after = await measure(pids);

    const reference = (before.cores[0] + after.cores[0]) / 2;
    const pct = (c) => `${(c * 100).toFixed(1)} %`;
    console.log(`add-on process, no page before: ${pct(before.cores[0])} of a core; after: ${pct(after.cores[0])}`);
    console.log(`add-on process, page open: ${pct(open.cores[0])} of a core`);
    console.log(`web server process: no page ${pct((before.cores[1] + after.cores[1]) / 2)}, page open ${pct(open.cores[1])}`);
    const chromiumTotal = Object.values(chromiumCores).reduce((a, b) => a + b, 0);
    console.log(`Chromium, page open: ${pct(chromiumTotal)} (` +
      `${Object.entries(chromiumCores).map(([type, c]) => `${type} ${pct(c)}`).join(', ')})`);
    console.log(`added by the page to the add-on process: ${(open.cores[0] - reference).toFixed(3)} cores (target at most 0.3)`);
    for (const uid of Object.keys(open.extra)) {
      const rate = (open.extraAfter[uid] - open.extra[uid]) / open.time;
      console.log(`previews drawn per second, ${names[uid]}: ${rate.toFixed(1)} (target at least 28)`);
    }
    console.log(`preview sizes: ${sizes.join(', ')}; ${seconds} s windows`);
  } finally {
    if (browser) await browser.close();
    if (studio) {
      await new Promise((resolve) => { studio.server.on('exit', resolve); studio.server.kill('SIGTERM'); });
    }
    animation.kill();
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
}

main().catch((error) => {
  console.error(error);
  process.exitCode = 1;
});
