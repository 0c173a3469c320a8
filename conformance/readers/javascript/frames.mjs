// What the JavaScript readers share: the manifest, the messages of the schema, and frames as they travel.

import { createFileRegistry, fromBinary } from "@bufbuild/protobuf";
import { FileDescriptorSetSchema } from "@bufbuild/protobuf/wkt";
import { readFileSync } from "node:fs";

export const TAGGED = 1;
export const DATA = 2;
const LAST = 0x80;
const HEADER_SIZE = 24;

const root = new URL("../../", import.meta.url);

export function readFile(path) {
    return readFileSync(new URL(path, root));
}

export function manifest() {
    return JSON.parse(readFile("manifest.json")).vectors;
}

/** The messages of the schema; `path` is that of a set of descriptors. */
export function readSchema(path) {
    return createFileRegistry(fromBinary(FileDescriptorSetSchema, readFileSync(path)));
}

/** The messages in these bytes, each a list of frames. */
export function split(data) {
    const view = new DataView(data.buffer, data.byteOffset, data.byteLength);
    const messages = [];
    let frames = [];
    for (let at = 0; at < data.length; ) {
        const kind = view.getUint8(at);
        const tagEnd = at + HEADER_SIZE + view.getUint16(at + 2, true);
        const end = tagEnd + Number(view.getBigUint64(at + 16, true));
        if (end > data.length) {
            throw new Error(`${end - data.length} bytes of the last frame are missing`);
        }
        frames.push({
            kind: kind & ~LAST,
            type: view.getUint8(at + 1),
            stream: view.getUint32(at + 4, true),
            index: Number(view.getBigUint64(at + 8, true)),
            tag: data.toString("utf8", at + HEADER_SIZE, tagEnd),
            content: data.subarray(tagEnd, end),
        });
        if (kind & LAST) {
            messages.push(frames);
            frames = [];
        }
        at = end;
    }
    if (frames.length > 0) {
        throw new Error("the last frame of a message is missing");
    }
    return messages;
}

/** One message as bytes. */
export function join(frames) {
    const parts = [];
    for (const frame of frames) {
        const tag = Buffer.from(frame.tag);
        const header = Buffer.alloc(HEADER_SIZE);
        header.writeUInt8(frame.kind | (frame === frames.at(-1) ? LAST : 0), 0);
        header.writeUInt8(frame.type, 1);
        header.writeUInt16LE(tag.length, 2);
        header.writeUInt32LE(frame.stream, 4);
        header.writeBigUInt64LE(BigInt(frame.index), 8);
        header.writeBigUInt64LE(BigInt(frame.content.length), 16);
        parts.push(header, tag, frame.content);
    }
    return Buffer.concat(parts);
}
