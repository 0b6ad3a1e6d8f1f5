'use strict';
// Pictures that differ from the one before (mpdecimate's defaults). Packet counts alone do not
// show a dropped picture: the add-on repeats the last picture on its 30 fps grid when none came,
// and x11grab writes whatever the screen holds at each tick of its clock, changed or not.
const { spawnSync } = require('child_process');

function distinct(file) {
  const r = spawnSync('ffmpeg', ['-v', 'error', '-i', file, '-vf', 'mpdecimate', '-f', 'framecrc', '-'],
    { encoding: 'utf8', maxBuffer: 64 << 20 });
  return r.stdout.split('\n').filter((line) => line && !line.startsWith('#')).length;
}

module.exports = { distinct };
