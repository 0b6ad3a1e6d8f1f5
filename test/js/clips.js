'use strict';
// What a user's own tools say about a recorded file.
const { spawnSync } = require('child_process');

// The container's duration in seconds, as ffprobe reads it; NaN for a file it cannot open.
function duration(file) {
  const r = spawnSync('ffprobe', ['-v', 'error', '-show_entries', 'format=duration', '-of', 'csv=p=0', file], { encoding: 'utf8' });
  return r.status === 0 && r.stdout.trim() ? Number(r.stdout.trim()) : NaN;
}

// Decodes the whole file with ffmpeg; the error lines it printed ('' for a clean file).
function decodeErrors(file) {
  return spawnSync('ffmpeg', ['-v', 'error', '-i', file, '-f', 'null', '-'], { encoding: 'utf8' }).stderr.trim();
}

module.exports = { duration, decodeErrors };
