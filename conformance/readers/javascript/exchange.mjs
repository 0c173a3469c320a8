// Writes random messages with a library for JavaScript, has the library in C++ read them and write them again, and
// compares what comes back field by field.
//
//     node exchange.mjs SCHEMA ECHO [COUNT [SEED]]
//
// SCHEMA is a set of descriptors, ECHO the program krutil_conformance_echo, COUNT the number of messages of each type
// (1000 without it). Ends with status 1 at the first difference, which it tells with the seed. ../random.json holds what
// random messages keep to.

import { create, fromBinary, ScalarType, toBinary } from "@bufbuild/protobuf";
import { reflect } from "@bufbuild/protobuf/reflect";
import { spawnSync } from "node:child_process";
import { readFileSync } from "node:fs";

import * as frames from "./frames.mjs";

// Messages that one run of the echo gets: few enough to be held, enough for the start of a program not to matter.
const BATCH = 1000;
const STREAM = 7;
const DEEPEST = 3;
const LARGE = 2048; // bytes of elements from which the library puts them into a frame of their own

// Bytes of an element, and the type of its data frame, by the code of its type.
const ELEMENTS = new Map([
    [1, [1, 13]], [2, [2, 14]], [4, [4, 12]], [5, [8, 11]], [6, [1, 3]], [7, [1, 4]], [8, [2, 5]], [9, [2, 6]],
    [10, [4, 7]], [11, [4, 8]], [12, [8, 9]], [13, [8, 10]], [14, [8, 16]], [15, [16, 15]], [16, [2, 17]],
    [17, [2, 18]], [18, [4, 19]], [19, [4, 20]], [20, [8, 21]], [21, [8, 22]], [22, [16, 23]], [23, [16, 24]],
]);

/** Random numbers from a seed (xorshift): the same ones on every run. */
class Random {
    constructor(seed) {
        this.state = (BigInt(seed) * 0x9e3779b97f4a7c15n + 1n) & 0xffffffffffffffffn;
    }

    bits() {
        let x = this.state;
        x ^= (x << 13n) & 0xffffffffffffffffn;
        x ^= x >> 7n;
        x ^= (x << 17n) & 0xffffffffffffffffn;
        this.state = x;
        return x;
    }

    /** An integer from 0 up to below `end`. */
    below(end) {
        return Number((this.bits() >> 11n) % BigInt(end));
    }

    choice(values) {
        return values[this.below(values.length)];
    }

    times(count, make) {
        return Array.from({ length: count }, make);
    }
}

function fullName(field) {
    return `${field.parent.typeName}.${field.name}`;
}

/** Makes random messages; `types` tells message name and frame type by tag. */
class Writer {
    constructor(schema, types, rules, random) {
        Object.assign(this, { schema, types, rules, random });
    }

    /** The frames of one message. */
    message(tag) {
        this.frames = [];
        this.append(tag);
        return this.frames;
    }

    /** Appends an object's frames, those first that it refers to; returns the index of its own. */
    append(tag) {
        const { name, type } = this.types.get(tag);
        const description = this.schema.getMessage(name);
        const message = reflect(description, create(description));
        if (name === this.rules.arrays) {
            this.fillArray(message);
        } else {
            this.fill(message, name, 0);
        }
        if (tag in this.rules.state_events) {
            message.set(description.field.type, this.rules.state_events[tag]);
        }
        return this.appendFrame(frames.TAGGED, type, tag, Buffer.from(toBinary(description, message.message)));
    }

    appendFrame(kind, type, tag, content) {
        const index = this.frames.length + 1;
        this.frames.push({ kind, type, stream: STREAM, index, tag, content });
        return index;
    }

    fill(message, path, depth) {
        const chosen = message.oneofs.map((oneof) => this.random.choice(oneof.fields));
        for (const field of message.fields) {
            const place = `${path}.${field.name}`;
            const leftOut = [place, fullName(field)].some((each) => this.rules.left_out.includes(each));
            const notChosen = field.oneof !== undefined && !chosen.includes(field);
            const absent = this.rules.present_or_not.includes(fullName(field)) && this.random.below(2) === 0;
            if (leftOut || notChosen || absent) {
                continue;
            }
            if (field.fieldKind === "message") {
                message.set(field, this.nested(field.message, place, depth));
            } else if (field.fieldKind !== "list") {
                message.set(field, this.value(field));
            } else if (field.listKind !== "message") {
                this.fillList(message.get(field), field);
            } else if (depth < DEEPEST) {
                this.random
                    .times(this.random.below(3), () => this.nested(field.message, place, depth + 1))
                    .forEach((each) => message.get(field).add(each));
            }
        }
    }

    nested(description, path, depth) {
        const message = reflect(description, create(description));
        this.fill(message, path, depth);
        return message;
    }

    fillList(list, field) {
        const values = this.random.times(this.random.below(4), () => this.value(field));
        // Lists of enumerators are sets, which the library writes in ascending order.
        const wanted = field.listKind === "enum" ? [...new Set(values)].sort((a, b) => a - b) : values;
        wanted.forEach((each) => list.add(each));
    }

    value(field) {
        const references = this.rules.references[fullName(field)];
        if (references !== undefined) {
            const tag = this.random.choice(references);
            return BigInt(tag === "" ? 0 : this.append(tag));
        }
        if (field.enum !== undefined) {
            const least = this.rules.no_default_number.includes(field.enum.typeName) ? 1 : 0;
            return this.random.choice(field.enum.values.slice(least)).number;
        }
        let value = this.scalar(field.scalar);
        while (!value && this.rules.not_zero_or_empty.includes(fullName(field))) {
            value = this.scalar(field.scalar);
        }
        return value;
    }

    scalar(type) {
        switch (type) {
            case ScalarType.BOOL:
                return this.random.below(2) === 1;
            case ScalarType.STRING:
                return this.text();
            case ScalarType.DOUBLE:
                return this.double();
            case ScalarType.INT32:
                return Number(BigInt.asIntN(32, this.integer()));
            case ScalarType.UINT32:
                return Number(BigInt.asUintN(32, this.integer()));
            case ScalarType.INT64:
                return BigInt.asIntN(64, this.integer());
            case ScalarType.UINT64:
                return BigInt.asUintN(64, this.integer());
            default:
                throw new Error(`no random values of scalar type ${type}`);
        }
    }

    integer() {
        const edges = [0n, 1n, -1n, 1n << 31n, 1n << 63n, (1n << 31n) - 1n, (1n << 63n) - 1n];
        return this.random.choice([...edges, this.random.bits(), this.random.bits() >> BigInt(this.random.below(64))]);
    }

    text() {
        const end = this.random.choice([0x80, 0x800, 0xd800, 0x110000]);
        return this.random
            .times(this.random.choice([0, 1, 5, 200]), () => this.random.below(end))
            .filter((each) => each < 0xd800 || each > 0xdfff)
            .map((each) => String.fromCodePoint(each))
            .join("");
    }

    double() {
        const [any] = new Float64Array(new BigUint64Array([this.random.bits()]).buffer);
        return this.random.choice([any, 0, -0, 1.5, -1, Infinity, -Infinity, 5e-324, NaN]);
    }

    fillArray(message) {
        const code = this.random.choice([...ELEMENTS.keys()]);
        const [elementSize, dataType] = ELEMENTS.get(code);
        const extents = this.random.times(this.random.below(4), () => this.random.below(6));
        if (this.random.below(10) === 0) {
            extents.push(this.random.below(1000));
        }
        const size = extents.reduce((product, extent) => product * extent, elementSize);
        const content = Buffer.from(this.random.times(size, () => this.random.below(code === 1 ? 2 : 256)));
        const field = message.desc.field;
        message.set(field.elementType, code);
        extents.forEach((extent) => message.get(field.dimensions).add(BigInt(extent)));
        message.set(field.order, 1 + this.random.below(2));
        if (size < LARGE) {
            message.set(field.inlineElements, new Uint8Array(content));
        } else {
            message.set(field.dataID, BigInt(this.appendFrame(frames.DATA, dataType, "", content)));
        }
    }
}

function sameValue(one, other) {
    if (one instanceof Uint8Array) {
        return Buffer.from(one).equals(Buffer.from(other));
    }
    return Object.is(one, other);
}

/** The paths at which two messages of one type differ. */
function differences(ours, theirs, path) {
    return ours.fields.flatMap((field) => {
        const place = `${path}.${field.name}`;
        if (ours.isSet(field) !== theirs.isSet(field)) {
            return [`${place}: written: ${ours.isSet(field)}, came back: ${theirs.isSet(field)}`];
        }
        if (!ours.isSet(field)) {
            return [];
        }
        const isList = field.fieldKind === "list";
        const mine = isList ? [...ours.get(field)] : [ours.get(field)];
        const yours = isList ? [...theirs.get(field)] : [theirs.get(field)];
        if (mine.length !== yours.length) {
            return [`${place}: ${mine.length} values were written, ${yours.length} came back`];
        }
        return mine.flatMap((one, position) => {
            if (field.message !== undefined) {
                return differences(one, yours[position], place);
            }
            return sameValue(one, yours[position]) ? [] : [`${place}: ${one} was written, ${yours[position]} came back`];
        });
    });
}

/** What is different between the frames of one message, as they went and came. */
function compare(written, returned, writer) {
    const outside = (message) => JSON.stringify(message.map((frame) => ({ ...frame, content: undefined })));
    if (outside(written) !== outside(returned)) {
        return [`frames ${outside(written)} were written, ${outside(returned)} came back`];
    }
    return written.flatMap((ours, position) => {
        const theirs = returned[position];
        if (ours.kind === frames.DATA) {
            return ours.content.equals(theirs.content) ? [] : [`frame ${ours.index}: its data came back changed`];
        }
        const { name } = writer.types.get(ours.tag);
        const read = (frame) => {
            const description = writer.schema.getMessage(name);
            return reflect(description, fromBinary(description, frame.content));
        };
        return differences(read(ours), read(theirs), name);
    });
}

function exchange(writer, tag, count, echo) {
    const written = writer.random.times(count, () => writer.message(tag));
    const done = spawnSync(echo, {
        input: Buffer.concat(written.map(frames.join)),
        maxBuffer: 1 << 30,
        stdio: ["pipe", "pipe", "inherit"],
    });
    if (done.status !== 0) {
        return [`${tag}: ${echo} has ended with status ${done.status}`];
    }
    const returned = frames.split(done.stdout);
    if (returned.length !== count) {
        return [`${tag}: ${count} messages were written, ${returned.length} came back`];
    }
    return written.flatMap((message, position) =>
        compare(message, returned[position], writer).map((finding) => `${tag}: message ${position + 1}: ${finding}`),
    );
}

function main(schema, echo, count = "1000", seed = "1") {
    const types = new Map();
    for (const vector of frames.manifest().filter((each) => each.well_formed)) {
        for (const entry of vector.frames.filter((each) => each.kind === "tagged")) {
            types.set(entry.tag, { name: entry.message, type: entry.frame_type });
        }
    }
    const rules = JSON.parse(readFileSync(new URL("../random.json", import.meta.url)));
    const writer = new Writer(frames.readSchema(schema), types, rules, new Random(seed));
    for (const tag of types.keys()) {
        for (let begin = 0; begin < Number(count); begin += BATCH) {
            const findings = exchange(writer, tag, Math.min(BATCH, Number(count) - begin), echo);
            if (findings.length > 0) {
                console.log([...findings.slice(0, 10), `(seed ${seed}, behind ${begin} messages of this type)`].join("\n"));
                return 1;
            }
        }
    }
    console.log(`${types.size} types, ${count} messages each: all came back as they were written`);
    return 0;
}

process.exitCode = main(...process.argv.slice(2));
