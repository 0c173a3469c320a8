// Reads the conformance vectors with a library for JavaScript, and writes them again.
//
//     node check_vectors.mjs SCHEMA
//
// SCHEMA is a set of descriptors. Prints what differs from the manifest, one finding a line, and ends with status 1 then.

import { fromBinary, toBinary, toJsonString } from "@bufbuild/protobuf";
import { isDeepStrictEqual } from "node:util";

import * as frames from "./frames.mjs";

const NAME = "javascript";

// Whether there is a NaN, which JSON has without its payload. Such a payload may be lost on the way.
function hasNan(fields) {
    return fields === "NaN" || (typeof fields === "object" && Object.values(fields).some(hasNan));
}

// What is wrong about one content, or nothing.
function checkContent(content, entry, schema, wellFormed) {
    const expected = entry.parses !== (entry.parses_differently_for ?? []).includes(NAME);
    const description = schema.getMessage(entry.message);
    let message;
    try {
        message = fromBinary(description, content);
    } catch (error) {
        return expected ? `expected it to be read, got: ${error.message}` : undefined;
    }
    if (!expected) {
        return "expected it to be refused, but it was read";
    }
    if (entry.fields === undefined) {
        return undefined;
    }
    // By way of text, as the manifest: a negative zero has lost its sign there.
    const found = JSON.parse(toJsonString(description, message, { useProtoFieldName: true }));
    if (!isDeepStrictEqual(found, entry.fields)) {
        return `expected ${JSON.stringify(entry.fields)}, got ${JSON.stringify(found)}`;
    }
    if (wellFormed && !hasNan(entry.fields)) {
        const again = Buffer.from(toBinary(description, message));
        if (!again.equals(content)) {
            return `written again it is ${again.toString("hex")} in place of ${content.toString("hex")}`;
        }
    }
    return undefined;
}

function checkVector(vector, schema) {
    const data = frames.readFile(vector.bytes);
    const [message, ...more] = frames.split(data);
    const findings = [];
    if (more.length !== 0 || message.length !== vector.frames.length) {
        findings.push(`expected one message of ${vector.frames.length} frames`);
    }
    vector.frames.forEach((entry, position) => {
        const expected = {
            kind: entry.kind === "tagged" ? frames.TAGGED : frames.DATA,
            type: entry.frame_type,
            stream: entry.stream,
            index: entry.index,
            tag: entry.tag ?? "",
            content: data.subarray(entry.offset, entry.offset + entry.size),
        };
        if (!isDeepStrictEqual(message[position], expected)) {
            findings.push(`frame ${entry.index} is not where and what the manifest says`);
        } else if (entry.message !== undefined) {
            const finding = checkContent(expected.content, entry, schema, vector.well_formed);
            if (finding !== undefined) {
                findings.push(`frame ${entry.index}: ${finding}`);
            }
        }
    });
    return findings;
}

const schema = frames.readSchema(process.argv[2]);
const vectors = frames.manifest();
let count = 0;
for (const vector of vectors) {
    for (const finding of checkVector(vector, schema)) {
        console.log(`${vector.type} ${vector.name}: ${finding}`);
        ++count;
    }
}
console.log(`${vectors.length} vectors, ${count} findings`);
process.exitCode = count === 0 ? 0 : 1;
