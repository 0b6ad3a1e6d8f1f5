'use strict';
// What a user's own tools say about a recorded file.
const { execFileSync, spawnSync } = require('child_process');

// ffprobe's JSON of the streams and the duration, or of the given -show_entries and options.
function probe(file, entries = 'stream=codec_type,codec_name,profile,width,height,sample_rate,channels,extradata_size' +
  ':format=duration', ...options) {
  return JSON.parse(execFileSync('ffprobe', ['-v', 'error', ...options, '-show_entries', entries, '-of', 'json', file],
    { encoding: 'utf8' }));
}

// The container's duration in seconds, as ffprobe reads it; NaN for a file it cannot open.
function duration(file) {
  const r = spawnSync('ffprobe', ['-v', 'error', '-show_entries', 'format=duration', '-of', 'csv=p=0', file], { encoding: 'utf8' });
  return r.status === 0 && r.stdout.trim() ? Number(r.stdout.trim()) : NaN;
}

// Decodes the whole file with ffmpeg; the error lines it printed ('' for a clean file).
function decodeErrors(file) {
  return spawnSync('ffmpeg', ['-v', 'error', '-i', file, '-f', 'null', '-'], { encoding: 'utf8' }).stderr.trim();
}

// The file's sound as FFmpeg decodes it, mixed to one channel at `rate`: 32-bit float samples.
function decode(file, rate = 48000) {
  const raw = execFileSync('ffmpeg', ['-v', 'error', '-i', file, '-f', 'f32le', '-ac', '1', '-ar', String(rate), '-'],
    { maxBuffer: 1 << 28 });
  return new Float32Array(raw.buffer, raw.byteOffset, raw.length / 4);
}

// Relative power of one frequency in mono float samples (Goertzel).
function power(samples, rate, frequency) {
  const k = 2 * Math.cos((2 * Math.PI * frequency) / rate);
  let s1 = 0;
  let s2 = 0;
  for (const x of samples) {
    const s0 = x + k * s1 - s2;
    s2 = s1;
    s1 = s0;
  }
  return (s1 * s1 + s2 * s2 - k * s1 * s2) / (samples.length * samples.length);
}

// What two other players make of the file: GStreamer plays it to the end without an error
// (`played`), and GStreamer's and MediaInfo's durations in seconds (NaN when they find none).
function otherPlayers(file) {
  const play = spawnSync('gst-launch-1.0', ['-q', 'playbin', `uri=file://${file}`, 'video-sink=fakesink sync=false',
    'audio-sink=fakesink sync=false'], { encoding: 'utf8', timeout: 60000 });
  const discovered = spawnSync('gst-discoverer-1.0', [file], { encoding: 'utf8' }).stdout;
  const [h, m, s] = (/Duration: (\d+):(\d+):([\d.]+)/.exec(discovered) || []).slice(1).map(Number);
  const mediainfo = spawnSync('mediainfo', ['--Inform=General;%Duration%', file], { encoding: 'utf8' }).stdout.trim();
  return {
    played: play.status === 0 && !/ERROR/.test(play.stdout + play.stderr),
    gstreamer: h === undefined ? NaN : h * 3600 + m * 60 + s,
    mediainfo: mediainfo ? Number(mediainfo) / 1000 : NaN,
  };
}

module.exports = { probe, duration, decodeErrors, decode, power, otherPlayers };
