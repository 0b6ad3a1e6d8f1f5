'use strict';
// The studio page in Debian's Chromium, driven by puppeteer-core: what a host built on Chromium
// does with the add-on (list, preview, meter, record, play back, show warnings), on a private
// desktop whose picture (test/tools/xpattern.cc's four colour blocks over the whole screen) and
// sound are known. Leaves a screenshot in artefacts/studio.png.
const test = require('node:test');
const assert = require('node:assert');
const { spawn, execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const puppeteer = require('puppeteer-core');
const { startDesktop, playTone } = require('../../scripts/desktop');
const { root } = require('./addon');

const BLOCKS = [[255, 0, 0], [0, 255, 0], [0, 0, 255], [255, 255, 255]];  // xpattern, left to right
// A blue picture with a red top-left quadrant: the colours and their places are checked.
const CAMERA = 'Studio Quadrants=color=c=blue:size=640x360:rate=30,drawbox=x=0:y=0:w=320:h=180:color=red:t=fill';
const LEVELS = 6;  // "within a few levels" of the source colour, after YUV and scaling
const sleep = (ms) => new Promise((resolve) => setTimeout(resolve, ms));

function startStudio(env, folder) {
  const server = spawn(process.execPath, [path.join(root, 'examples', 'studio', 'server.js'), '0', folder], {
    env: { ...process.env, ...env }, stdio: ['ignore', 'pipe', 'inherit'],
  });
  return new Promise((resolve, reject) => {
    let text = '';
    server.stdout.on('data', (d) => {
      text += d;
      const url = text.match(/open (http:\/\/127\.0\.0\.1:\d+\/)/);
      if (url) resolve({ server, url: url[1] });
    });
    server.on('exit', (code) => reject(new Error(`studio ended (${code}): ${text}`)));
  });
}

// Polls fn in the page until it returns a truthy value.
async function until(page, fn, arg, what, timeoutMs = 15000) {
  try {
    return await (await page.waitForFunction(fn, { timeout: timeoutMs, polling: 100 }, arg)).jsonValue();
  } catch (e) {
    throw new Error(`${what}: ${e.message}`);
  }
}

const near = (pixel, colour) => colour.every((c, i) => Math.abs(pixel[i] - c) <= LEVELS) && pixel[3] === 255;

test('the studio page in Chromium', async (t) => {
  const desktop = await startDesktop({
    width: 1280, height: 720,
    sinks: [{ name: 'tavio_speakers', description: 'Tavio Speakers', default: true }],
    microphone: { name: 'tavio_mic', description: 'Tavio Microphone', frequency: 440 },
  });
  t.after(() => desktop.stop());
  const folder = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-studio-'));
  t.after(() => fs.rmSync(folder, { recursive: true, force: true }));
  const xpattern = path.join(folder, 'xpattern');
  execFileSync('g++', ['-O2', '-o', xpattern, path.join(root, 'test/tools/xpattern.cc'), '-lxcb']);
  const blocks = spawn(xpattern, ['0', '0', '1280', '720'], { env: { ...process.env, ...desktop.env }, stdio: ['ignore', 'pipe', 'inherit'] });
  t.after(() => blocks.kill());
  await new Promise((resolve) => blocks.stdout.on('data', (d) => { if (String(d).includes('ready')) resolve(); }));
  const { server, url } = await startStudio({ ...desktop.env, TAVIO_TEST_CAMERAS: CAMERA }, folder);
  t.after(() => new Promise((resolve) => { server.on('exit', resolve); server.kill('SIGTERM'); }));
  const browser = await puppeteer.launch({
    executablePath: '/usr/bin/chromium',
    headless: true,
    networkEnabled: false,  // puppeteer's network events would copy every picture to this process
    // Root has no sandbox; the page's own playback must not reach the sink whose meter is read.
    args: ['--no-sandbox', '--mute-audio', '--autoplay-policy=no-user-gesture-required'],
  });
  t.after(() => browser.close());
  const page = await browser.newPage();
  await page.setViewport({ width: 1280, height: 1000 });
  await page.goto(`${url}?rate=30`);
  const card = (type) => `.source[data-type="${type}"]`;

  await t.test('one entry per source, with its name, type and default mark', async () => {
    await until(page, () => document.querySelectorAll('.source').length >= 4, null, 'four sources');
    await sleep(500);
    const entries = await page.$$eval('.source', (cards) => cards.map((c) => [
      c.dataset.type, c.querySelector('.title').textContent, Boolean(c.querySelector('.selected'))]));
    assert.deepStrictEqual(entries, [
      ['mfce_video', 'Studio Quadrants', true], ['mfce_audio', 'Tavio Microphone', true],
      ['wasapi', 'Tavio Speakers', true], ['dxgi', 'screen', true]]);
  });

  await t.test('the canvases show the colour blocks on the desktop and the quadrants of the camera', async () => {
    await until(page, () => Object.values(window.studio.drawn).every((n) => n > 10), null, 'previews drawn');
    const pictures = await page.$$eval('canvas', (canvases) => canvases.map((c) => {
      const at = (x, y) => Array.from(c.getContext('2d').getImageData(Math.floor(x * c.width), Math.floor(y * c.height), 1, 1).data);
      return { width: c.width, topLeft: at(0.25, 0.25), bottomRight: at(0.75, 0.75), row: [1, 3, 5, 7].map((x) => at(x / 8, 0.5)) };
    }));
    const [camera, display] = pictures;
    assert.ok(camera.width > 100 && camera.width <= 640, `camera preview ${camera.width} wide`);
    assert.ok(near(camera.topLeft, [255, 0, 0]), `camera top left ${camera.topLeft}`);
    assert.ok(near(camera.bottomRight, [0, 0, 255]), `camera bottom right ${camera.bottomRight}`);
    BLOCKS.forEach((colour, i) => assert.ok(near(display.row[i], colour), `desktop block ${i}: ${display.row[i]}`));
  });

  await t.test('the endpoint meter rises with a tone and falls when it stops', async () => {
    const meters = `${card('wasapi')} meter`;
    const level = (selector) => Math.max(...[...document.querySelectorAll(selector)].map((m) => m.value));
    await until(page, (s) => document.querySelectorAll(s).length === 2, meters, 'two channel meters');
    assert.ok(await page.evaluate(level, meters) < 0.02, 'silence before the tone');
    const tone = playTone(desktop.env, { amplitude: 0.5, sink: 'tavio_speakers' });
    try {
      await until(page, (s) => [...document.querySelectorAll(s)].every((m) => m.value > 0.4), meters, 'meters at the tone');
    } finally {
      tone.kill();
    }
    await until(page, (s) => [...document.querySelectorAll(s)].every((m) => m.value < 0.02), meters, 'meters after the tone');
  });

  await t.test('a recorded clip is listed and plays to its end with its duration', async () => {
    await page.click(`${card('mfce_video')} button`);
    await until(page, (s) => document.querySelector(s).classList.contains('recording'), card('mfce_video'), 'recording mark');
    const started = Date.now();
    await sleep(3000);
    await page.click(`${card('mfce_video')} button`);
    const seconds = (Date.now() - started) / 1000;
    await until(page, () => document.querySelector('.clips video'), null, 'a clip listed');
    const listed = await page.$eval('.clips li', (li) => li.textContent);
    assert.match(listed, /^Studio_Quadrants-\d+-.*\.mp4 — video, \d+\.\d\d s, \d+ KiB$/);
    const played = await page.$eval('.clips video', (video) => new Promise((resolve, reject) => {
      video.addEventListener('ended', () => resolve({ duration: video.duration, at: video.currentTime, width: video.videoWidth }));
      video.addEventListener('error', () => reject(new Error(`video error ${video.error && video.error.code}`)));
      video.play().catch(reject);
    }));
    assert.strictEqual(played.width, 640);
    assert.ok(Math.abs(played.duration - seconds) < 0.5, `${played.duration} s played for ${seconds} s recorded`);
    assert.ok(Math.abs(played.at - played.duration) < 0.1, `stopped at ${played.at} of ${played.duration} s`);
    const listedSeconds = Number(listed.match(/video, (\d+\.\d\d) s/)[1]);
    assert.ok(Math.abs(listedSeconds - played.duration) < 0.05, `listed ${listedSeconds} s`);
  });

  await t.test('a clip started into a missing folder shows a warning line', async () => {
    const before = await page.evaluate(() => window.studio.warnings.length);
    await page.$eval('#folder', (input, value) => {
      input.value = value;
      input.dispatchEvent(new Event('change'));
    }, path.join(folder, 'missing', 'deeper'));
    await until(page, (f) => document.querySelector('#folder').value === f, path.join(folder, 'missing', 'deeper'), 'folder set');
    await page.click(`${card('dxgi')} button`);
    const lines = await until(page, (n) => window.studio.warnings.length > n && window.studio.warnings, before, 'a warning line');
    await page.click(`${card('dxgi')} button`);
    // The whole warning: the stamped line and the failure's text on the tab-led line below it.
    assert.match(lines[lines.length - 1],
      /^\d+: Warning: \w{3} \w{3} [ \d]\d \d\d:\d\d:\d\d \d{4}\n\tnative\/[\w/]+\(\d+\): 0x[0-9a-f]{8}: .*cannot find the path/);
    const shown = await page.$eval('.warnings li', (li) => li.textContent);
    assert.strictEqual(shown, lines[lines.length - 1]);
  });

  fs.mkdirSync(path.join(root, 'artefacts'), { recursive: true });
  await page.screenshot({ path: path.join(root, 'artefacts', 'studio.png'), fullPage: true });
});
