'use strict';
// Audio playback endpoints from JavaScript: enumeration, level peaks and AAC recordings of what a
// PulseAudio sink plays.
const test = require('node:test');
const assert = require('node:assert');
const { execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { runAddon } = require('./addon');
const { probe, decode, duration, power } = require('./clips');
const { startDesktop } = require('../../scripts/desktop');
const { startPipeWire } = require('./pipewire');

const SINKS = [
  { name: 'tavio_left', description: 'Tavio Left Speaker', rate: 48000, channels: 2 },
  { name: 'tavio_main', description: 'Tavio Main Speaker', rate: 48000, channels: 2, default: true },
  { name: 'tavio_mono', description: 'Tavio Mono Speaker', rate: 44100, channels: 1 },
];

// A sine tone WAV made with sox (which cannot play to PulseAudio here; paplay does that).
function tone(dir, { frequency = 440, seconds = 5, volume = 0.5, rate = 48000, channels = 2 } = {}) {
  const file = path.join(dir, `tone-${frequency}-${rate}-${channels}-${seconds}.wav`);
  if (!fs.existsSync(file)) {
    execFileSync('sox', ['-n', '-r', String(rate), '-c', String(channels), '-b', '16', file,
      'synth', String(seconds), 'sine', String(frequency), 'vol', String(volume)]);
  }
  return file;
}

// Script text: starts paplay of `file` into `sink` inside the child and returns the process.
const play = (file, sink) => `require('child_process').spawn('paplay', ['--device=${sink}', ${JSON.stringify(file)}], { stdio: 'ignore' })`;

const wasapi = (events) => events.filter((e) => e.source.type === 'wasapi').map((e) => e.source);

test('audio endpoints', async (t) => {
  const desktop = await startDesktop({ display: false, sinks: SINKS });
  t.after(() => desktop.stop());
  const env = desktop.env;
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-audio-'));
  t.after(() => fs.rmSync(dir, { recursive: true, force: true }));

  await t.test('every sink is a wasapi source, the default first and only it selected', async () => {
    const { reports, code } = await runAddon('addon.initialize(); report(events);', { env });
    assert.strictEqual(code, 0);
    const sources = wasapi(reports[0]);
    assert.deepStrictEqual(sources.map((s) => [s.name, s.selected]), [
      ['Tavio Main Speaker', 1], ['Tavio Left Speaker', 0], ['Tavio Mono Speaker', 0]]);
  });

  await t.test('getPreview of a sink playing a half-scale tone shows both channels near 0.5', async () => {
    const file = tone(dir, { seconds: 4 });
    const { reports, code, stdout } = await runAddon(`
      addon.initialize();
      await sleep(500);  // peaks exist only once the capture threads run; earlier reads end the process
      const uid = events.find((e) => e.source.type === 'wasapi' && e.source.name === 'Tavio Main Speaker').source.id;
      const quiet = addon.getPreview(uid);
      const player = ${play(file, 'tavio_main')};
      let preview = null;
      for (let i = 0; i < 300; i++) {
        await sleep(10);
        preview = addon.getPreview(uid);
        if (preview.left > 0.4 && preview.right > 0.4) break;
      }
      player.kill();
      const left = events.find((e) => e.source.name === 'Tavio Left Speaker').source.id;
      report({ quiet, preview, other: addon.getPreview(left) });`, { env });
    assert.strictEqual(code, 0, stdout);
    const { preview, other } = reports[0];
    assert.deepStrictEqual(Object.keys(preview).sort(), ['0', '1', 'left', 'right']);
    assert.ok(Math.abs(preview.left - 0.5) < 0.02, `left ${preview.left}`);
    assert.ok(Math.abs(preview.right - 0.5) < 0.02, `right ${preview.right}`);
    assert.strictEqual(preview['0'], preview.left);
    assert.strictEqual(preview['1'], preview.right);
    // The tone went to one sink only.
    assert.strictEqual(other.left, 0, JSON.stringify(other));
  });

  await t.test('a clip recorded while a 440 Hz tone plays is AAC at the sink rate and channels, as long as recorded', async () => {
    const file = tone(dir, { seconds: 6, rate: 44100, channels: 1 });
    const clip = path.join(dir, 'clip.mp4');
    const { reports, code, stdout } = await runAddon(`
      addon.initialize();
      await sleep(500);  // peaks exist only once the capture threads run
      const uid = events.find((e) => e.source.name === 'Tavio Mono Speaker').source.id;
      const player = ${play(file, 'tavio_mono')};
      for (let i = 0; i < 300 && !(addon.getPreview(uid).left > 0.4); i++) await sleep(10);
      addon.startCapture(uid, ${JSON.stringify(clip)});
      const start = Date.now();
      await sleep(3000);
      addon.stopCapture(uid);
      const wall = Date.now() - start;
      await sleep(500);  // the next packet finishes the file
      player.kill();
      report({ wall, clips: events.filter((e) => e.type === 'new-clip').length });`, { env });
    assert.strictEqual(code, 0, stdout);
    const { wall, clips } = reports[0];
    assert.strictEqual(clips, 1);
    const info = probe(clip);
    const audio = info.streams.find((s) => s.codec_type === 'audio');
    assert.strictEqual(audio.codec_name, 'aac');
    assert.strictEqual(Number(audio.sample_rate), 44100);
    assert.strictEqual(audio.channels, 1);
    const seconds = Number(info.format.duration);
    assert.ok(Math.abs(seconds * 1000 - wall) / wall < 0.05, `file ${seconds} s, recorded ${wall} ms`);
    const samples = decode(clip, 44100);
    const at440 = power(samples, 44100, 440);
    for (const other of [220, 330, 550, 880, 1000]) {
      assert.ok(at440 > 100 * power(samples, 44100, other), `440 Hz against ${other} Hz`);
    }
  });
});

test('a sink that goes away ends its capture thread with a warning', async () => {
  const desktop = await startDesktop({ display: false, sinks: [SINKS[1], SINKS[0]] });
  try {
    const env = desktop.env;
    const modules = execFileSync('pactl', ['list', 'short', 'modules'], { env: { ...process.env, ...env }, encoding: 'utf8' });
    const line = modules.split('\n').find((l) => l.includes('sink_name=tavio_left'));
    const index = line.split('\t')[0];
    const { stdout, code } = await runAddon(`
      addon.initialize();
      await sleep(500);
      require('child_process').execFileSync('pactl', ['unload-module', '${index}']);
      await sleep(500);`, { env });
    assert.strictEqual(code, 0);
    // Each warning's text starts with the failure time on its own line; the silence thread of the
    // vanished sink may report its own failure (line 194) before or after the capture thread.
    const lines = stdout.split('\n');
    const captureLines = lines.filter((l, i) => i > 0 && /^\d{13}: Warning: /.test(lines[i - 1]) && l.includes('(262)'));
    assert.strictEqual(captureLines.length, 1, stdout);
    assert.match(captureLines[0], /^\tnative\/capture\/audio\/wasapi\/source\(262\): 0x88890004: Audio device is no longer valid for capture\./);
    assert.strictEqual(lines.filter((l) => l.includes('(262)')).length, 1, 'only the vanished sink fails');
  } finally {
    desktop.stop();
  }
});

test('without a sound server the endpoints are missing, and the cameras and displays record as usual', async () => {
  const desktop = await startDesktop({ audio: false });
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-nosound-'));
  try {
    const { reports, stdout } = await runAddon(`
      addon.initialize();
      const found = events.map((e) => e.source);
      await sleep(500);
      for (const s of found) addon.startCapture(s.id, ${JSON.stringify(dir)} + '/' + s.type + '.mp4');
      await sleep(1000);
      for (const s of found) addon.stopCapture(s.id);
      await sleep(1000);
      report(found.map((s) => s.type));`,
    { env: { ...desktop.env, PULSE_SERVER: `unix:${dir}/no-such-pulse-server`, TAVIO_TEST_CAMERAS: 'Cam=testsrc2=size=320x240:rate=30' } });
    assert.match(stdout, /Warning: .*\n\tnative\/capture\/audio\/wasapi\/capturemethod\(30\): 0x80070490: Could not get the default device\./);
    assert.deepStrictEqual(reports[0], ['mfce_video', 'dxgi']);
    for (const type of reports[0]) {
      const length = duration(path.join(dir, `${type}.mp4`));
      assert.ok(length > 0.9 && length < 1.2, `${type}: ${length} s`);
    }
  } finally {
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
});

// Pro-audio sinks (PipeWire's pro-audio profile and the like) have channels without speaker
// positions. A tone played into each such channel must arrive in peaks and recordings, not silence.
test('sinks whose channels have no speaker positions record and preview what they play', async (t) => {
  const sinks = [
    { name: 'tavio_aux', description: 'Tavio Aux Sink', channels: 2, channelMap: 'aux0,aux1', default: true },
    { name: 'tavio_mixed', description: 'Tavio Mixed Sink', channels: 4, channelMap: 'front-left,front-right,aux0,aux1' },
  ];
  const desktop = await startDesktop({ display: false, sinks });
  t.after(() => desktop.stop());
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-aux-'));
  t.after(() => fs.rmSync(dir, { recursive: true, force: true }));

  for (const sink of sinks) {
    await t.test(`${sink.channelMap}: peaks and a clip near 0.5 on every channel, no warning`, async () => {
      // The file carries the sink's own map, so nothing is remixed on the way in.
      const file = tone(dir, { seconds: 5, channels: sink.channels });
      const clip = path.join(dir, `${sink.name}.mp4`);
      const { reports, code, stdout } = await runAddon(`
        addon.initialize();
        await sleep(500);
        const uid = events.find((e) => e.source.name === ${JSON.stringify(sink.description)}).source.id;
        const player = require('child_process').spawn('paplay', ['--device=${sink.name}',
          '--channel-map=${sink.channelMap}', ${JSON.stringify(file)}], { stdio: 'ignore' });
        let preview;
        for (let i = 0; i < 300; i++) {
          await sleep(10);
          preview = addon.getPreview(uid);
          if (Object.keys(preview).filter((k) => /^\\d+$/.test(k)).every((k) => preview[k] > 0.4)) break;
        }
        addon.startCapture(uid, ${JSON.stringify(clip)});
        await sleep(1500);
        addon.stopCapture(uid);
        await sleep(500);
        player.kill();
        report(preview);`, { env: desktop.env });
      assert.strictEqual(code, 0, stdout);
      const preview = reports[0];
      for (let c = 0; c < sink.channels; c++) assert.ok(Math.abs(preview[c] - 0.5) < 0.03, `peak ${c}: ${JSON.stringify(preview)}`);
      const info = probe(clip);
      assert.strictEqual(info.streams[0].channels, sink.channels);
      // The tone's amplitude in every channel of the decoded clip (its RMS times the square root of
      // 2), over the middle of the clip: AAC rings around the start and the end.
      const raw = execFileSync('ffmpeg', ['-v', 'error', '-i', clip, '-f', 'f32le', '-'], { maxBuffer: 1 << 26 });
      const samples = new Float32Array(raw.buffer, raw.byteOffset, raw.length / 4);
      const frames = samples.length / sink.channels;
      const sums = new Array(sink.channels).fill(0);
      for (let f = Math.floor(frames * 0.2); f < Math.floor(frames * 0.8); f++) {
        for (let c = 0; c < sink.channels; c++) sums[c] += samples[f * sink.channels + c] ** 2;
      }
      const amplitudes = sums.map((sum) => Math.sqrt((2 * sum) / (Math.floor(frames * 0.8) - Math.floor(frames * 0.2))));
      for (const a of amplitudes) assert.ok(Math.abs(a - 0.5) < 0.05, `clip amplitudes ${amplitudes}`);
      assert.doesNotMatch(stdout, /Warning/);
    });
  }
});

// Debian 12's desktops run PipeWire, whose PulseAudio server serves the endpoints and microphones.
// Like PulseAudio it would move an unplugged microphone's stream to another source.
test('PipeWire: endpoints and microphones record what plays; an unplugged microphone ends its clip', async (t) => {
  const pipewire = await startPipeWire({
    sinks: [{ name: 'pw_speakers', description: 'PipeWire Speakers' }],
    microphone: { name: 'pw_mic', description: 'PipeWire Microphone' },
  });
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-pipewire-clips-'));
  t.after(() => {
    pipewire.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  });
  const files = Object.fromEntries(['endpoint', 'microphone', 'unplugged'].map((n) => [n, path.join(dir, `${n}.mp4`)]));
  const [low, high] = [440, 880].map((frequency) => tone(dir, { frequency, seconds: 10 }));
  const { reports, stdout, stderr } = await runAddon(`
    const { execFileSync } = require('child_process');
    const files = ${JSON.stringify(files)};
    const players = [${play(low, 'pw_speakers')}, ${play(high, 'pw_mic_feed')}];
    addon.initialize();
    const found = events.map((e) => e.source);
    const speakers = found.find((s) => s.type === 'wasapi' && s.selected);
    const mic = found.find((s) => s.type === 'mfce_audio');
    await sleep(500);
    addon.startCapture(speakers.id, files.endpoint);
    addon.startCapture(mic.id, files.microphone);
    await sleep(1500);
    addon.stopCapture(speakers.id);
    addon.stopCapture(mic.id);
    addon.startCapture(mic.id, files.unplugged);
    await sleep(1000);
    const module = execFileSync('pactl', ['list', 'short', 'modules'], { encoding: 'utf8' })
      .split('\\n').find((l) => l.includes('source_name=pw_mic')).split('\\t')[0];
    execFileSync('pactl', ['unload-module', module]);
    await sleep(1000);
    addon.stopCapture(mic.id);
    players.forEach((p) => p.kill());
    report(found.map((s) => [s.type, s.name]));`, { env: pipewire.env });
  assert.deepStrictEqual(reports[0], [['mfce_audio', 'PipeWire Microphone'], ['wasapi', 'PipeWire Speakers'],
    ['wasapi', 'PipeWire Microphone Feed']], stdout + stderr);
  const heard = (file, frequency, other) => {
    const samples = decode(file);
    return power(samples, 48000, frequency) > 100 * power(samples, 48000, other);
  };
  for (const [name, frequency, other] of [['endpoint', 440, 880], ['microphone', 880, 440]]) {
    assert.ok(Math.abs(duration(files[name]) - 1.5) < 0.15, `${name}: ${duration(files[name])} s`);
    assert.ok(heard(files[name], frequency, other), `${name} holds its own tone only`);
  }
  assert.ok(Math.abs(duration(files.unplugged) - 1) < 0.2, `the unplugged clip ends at the loss: ${duration(files.unplugged)} s`);
  assert.ok(heard(files.unplugged, 880, 440), 'the unplugged microphone\'s clip holds no other source');
  assert.match(stdout, /capturemanager\(411\): 0xc00d3ea1: CaptureManager: the device failed while recording/);
});
