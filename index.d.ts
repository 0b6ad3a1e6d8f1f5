// Declarations of the add-on's seven functions and the events it sends.

/** `"dxgi"` display, `"wasapi"` audio playback endpoint, `"mfce_video"` camera, `"mfce_audio"` camera microphone. */
export type SourceType = 'dxgi' | 'wasapi' | 'mfce_video' | 'mfce_audio';

interface SourceBase {
  /** The uid that the other functions take. */
  id: number;
  /** The device's name. */
  name: string;
  /** 1 for the system's default (or first) device of its kind, else 0. */
  selected: 0 | 1;
}

/** A display or camera: its pictures are `width` × `height` RGBA, `size` bytes. */
export interface VideoSource extends SourceBase {
  type: 'dxgi' | 'mfce_video';
  pixelWidth: 4;
  width: number;
  height: number;
  size: number;
}

/** An audio playback endpoint or a camera microphone. */
export interface AudioSource extends SourceBase {
  type: 'wasapi' | 'mfce_audio';
}

export type Source = VideoSource | AudioSource;

export interface NewSourceEvent {
  type: 'new source';
  source: Source;
}

export interface NewClipEvent {
  type: 'new-clip';
  uid: number;
  filename: string;
  /** Wall-clock milliseconds since 1970, just after the source accepted the file. */
  start: number;
}

export type CaptureEvent = NewSourceEvent | NewClipEvent;

/** Level peaks of an audio source: 0.0 silence, about 1.0 full scale; one key per channel. */
export interface AudioPeaks {
  left: number;
  right: number;
  [channel: string]: number;
}

/** Stores the one event callback. Call it before `initialize`. */
export function setCallback(callback: (event: CaptureEvent) => void): undefined;

/** Finds every source, starts its capture and sends one `"new source"` event per source before it returns. */
export function initialize(): undefined;

/**
 * A video source's newest picture scaled to `width` × `height`, RGBA rows top to bottom
 * (`undefined` before the first frame), or an audio source's level peaks.
 */
export function getPreview(uid: number, width: number, height: number): Uint8ClampedArray | undefined;
export function getPreview(uid: number): AudioPeaks | undefined;

/** Starts recording source `uid` into the MP4 file `filename`, then sends a `"new-clip"` event. */
export function startCapture(uid: number, filename: string): undefined;

/** Ends the clip; the recorder finishes the file by itself shortly after. */
export function stopCapture(uid: number): undefined;

/** For a display: draw the mouse pointer into its pictures (`enabled` ≠ 0) or not. */
export function mouseCapture(uid: number, enabled: number): undefined;

/** Posts command 0x7F8F to the host window `window` and brings it to the front; 1 when posted. */
export function transfer(window: number): 0 | 1;
