'use strict';
// Glass to preview: how long after an X drawing call a host polling getPreview first sees the
// change on a 1920x1080 display, against how long after a test camera's picture leaves its source
// the host sees it (bench/clockcamera.js), in the same run.
//
// bench/tools/xflip (built here with g++) fills the whole screen with red, green or blue when told
// and prints the monotonic clock just before its drawing request; the add-on's process polls a
// 64x36 preview of the display as fast as its event loop turns (process.hrtime is the same clock)
// until the centre pixel has the new colour. The changes come 20-50 ms apart, at random, so they
// fall anywhere in the screen pump's cycle.
//   node bench/latency.js [changes=200]
const { execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop } = require('../scripts/desktop');
const { runAddon, root } = require('../test/js/addon');
const { CLOCK, CLOCK_READER } = require('./clockcamera');

const changes = Number(process.argv[2] || 200);

function summary(values, what) {
  const sorted = [...values].sort((a, b) => a - b);
  const at = (q) => sorted[Math.min(sorted.length - 1, Math.floor(q * sorted.length))];
  return `median ${at(0.5).toFixed(1)} ms, p95 ${at(0.95).toFixed(1)} ms, min ${sorted[0].toFixed(1)}, ` +
    `max ${sorted[sorted.length - 1].toFixed(1)} (${values.length} ${what})`;
}

async function main() {
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-bench-latency-'));
  const xflip = path.join(dir, 'xflip');
  execFileSync('g++', ['-O2', '-o', xflip, path.join(root, 'bench/tools/xflip.cc'), '-lxcb']);
  const desktop = await startDesktop({ width: 1920, height: 1080, microphone: null });
  try {
    const run = await runAddon(`${CLOCK_READER}
      const { spawn } = require('child_process');
      addon.initialize();
      const display = events.find((e) => e.type === 'new source' && e.source.type === 'dxgi').source;
      const camera = events.find((e) => e.type === 'new source' && e.source.type === 'mfce_video').source;
      const flip = spawn(${JSON.stringify(xflip)}, ['1920', '1080'], { stdio: ['pipe', 'pipe', 'inherit'] });
      const lines = [];
      let waiting = null;
      let buffered = '';
      flip.stdout.on('data', (chunk) => {
        buffered += chunk;
        let end;
        while ((end = buffered.indexOf('\\n')) >= 0) {
          lines.push(buffered.slice(0, end));
          buffered = buffered.slice(end + 1);
          if (waiting) waiting();
        }
      });
      const nextLine = async () => {
        while (!lines.length) await new Promise((resolve) => { waiting = resolve; });
        waiting = null;
        return lines.shift();
      };
      if (await nextLine() !== 'ready') throw new Error('xflip did not start');
      const nowUs = () => Number(process.hrtime.bigint() / 1000n);
      const wanted = { r: [255, 0, 0], g: [0, 255, 0], b: [0, 0, 255] };
      // A point a quarter in from the top-left corner: the pointer rests in the middle of the screen.
      const W = 64, H = 36, spot = ((H >> 2) * W + (W >> 2)) * 4;
      const shows = (colour) => {
        const p = addon.getPreview(display.id, W, H);
        return p && p.length && wanted[colour].every((v, i) => Math.abs(p[spot + i] - v) < 32);
      };
      await sleep(2000);
      const displayDelays = [];
      for (let i = 0; i < ${changes} + 5; i++) {
        const colour = 'rgb'[i % 3];
        flip.stdin.write(colour + '\\n');
        let seenAt = 0;
        const start = nowUs();
        while (!seenAt) {
          if (shows(colour)) seenAt = nowUs();
          else if (nowUs() - start > 2000000) throw new Error('the change never showed');
          else await new Promise((resolve) => setImmediate(resolve));
        }
        const drawnAt = Number(await nextLine());
        if (i >= 5) displayDelays.push((seenAt - drawnAt) / 1000);  // the first changes warm up
        await sleep(20 + Math.random() * 30);
      }
      flip.kill();
      const cameraDelays = await measureClock(camera.id, 10000);
      report({ display: displayDelays, camera: cameraDelays });
    `, { env: { ...desktop.env, TAVIO_TEST_CAMERAS: `Clock Camera=${CLOCK}` }, timeoutMs: (changes * 0.2 + 90) * 1000 });
    if (!run.reports.length) throw new Error(`add-on run failed (${run.code}): ${run.stderr}`);
    const { display, camera } = run.reports[0];
    console.log(`display, X drawing call -> first getPreview that shows it (1920x1080, 64x36 preview): ${summary(display, 'changes')}`);
    console.log(`camera, picture leaves the source -> first getPreview that shows it (1280x720, 320x180): ${summary(camera, 'new pictures')}`);
    console.log(`display median / camera median: ${(median(display) / median(camera)).toFixed(2)} ` +
      '(target: a display median of 20 ms or less)');
  } finally {
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
}

function median(values) {
  const sorted = [...values].sort((a, b) => a - b);
  return sorted[Math.floor(sorted.length / 2)];
}

main().catch((e) => { console.error(e); process.exit(1); });
