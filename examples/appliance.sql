-- A recorder's system database as an old package left it: at least one row for every change that an
-- upgrade from version 0 makes, and next to them rows that it must leave alone. A camera's name, and
-- the note of a row of another table, tells which: 'changes' or 'must stay'. A row says only what
-- matters; the rest are defaults. Each row has an id of its own, so that a new row moves no other.

CREATE TABLE camera (
  id INTEGER PRIMARY KEY,
  name TEXT NOT NULL DEFAULT '',
  ip TEXT NOT NULL DEFAULT '',
  port INTEGER NOT NULL DEFAULT 80,
  username TEXT NOT NULL DEFAULT 'root',
  password TEXT NOT NULL DEFAULT 'secret',
  vendor TEXT NOT NULL,
  model TEXT NOT NULL,
  firmware TEXT NOT NULL DEFAULT '5.40',
  channel TEXT NOT NULL DEFAULT '1',
  enabled INTEGER NOT NULL DEFAULT 1,
  deleted INTEGER NOT NULL DEFAULT 0,
  create_time INTEGER NOT NULL DEFAULT 1388534400,
  update_time INTEGER,
  owner_ds_id INTEGER DEFAULT 0,
  id_on_rec_server INTEGER DEFAULT 0,
  -- Picture and sound.
  video_type INTEGER NOT NULL DEFAULT 3,
  fov TEXT NOT NULL DEFAULT '',
  tv_standard INTEGER NOT NULL DEFAULT 0,
  osd_position INTEGER NOT NULL DEFAULT 0,
  osd_format TEXT NOT NULL DEFAULT '%Y-%m-%d %H:%M:%S',
  audio_format INTEGER NOT NULL DEFAULT 0,
  audio_volume REAL NOT NULL DEFAULT 0.5,
  rtsp_protocol INTEGER NOT NULL DEFAULT 0,
  rtsp_path TEXT,
  -- The three streams.
  rec_stream_no INTEGER NOT NULL DEFAULT 1,
  live_stream_no INTEGER NOT NULL DEFAULT 1,
  mobile_stream_no INTEGER NOT NULL DEFAULT 1,
  ui_stream_no TEXT NOT NULL DEFAULT '1,1,1',
  resolution TEXT NOT NULL DEFAULT '1920x1080',
  live_resolution TEXT NOT NULL DEFAULT '1280x720',
  mobile_resolution TEXT NOT NULL DEFAULT '640x360',
  rec_bitrate_ctrl INTEGER NOT NULL DEFAULT 1,
  live_bitrate_ctrl INTEGER NOT NULL DEFAULT 1,
  mobile_bitrate_ctrl INTEGER NOT NULL DEFAULT 1,
  rec_cbr_bitrate INTEGER NOT NULL DEFAULT 4096,
  live_cbr_bitrate INTEGER NOT NULL DEFAULT 1024,
  mobile_cbr_bitrate INTEGER NOT NULL DEFAULT 512,
  fps INTEGER NOT NULL DEFAULT 25,
  fps_2 INTEGER NOT NULL DEFAULT 25,
  live_fps INTEGER NOT NULL DEFAULT 15,
  mobile_fps INTEGER NOT NULL DEFAULT 5,
  -- Recording, motion, PTZ and wiring.
  rec_keep_days INTEGER NOT NULL DEFAULT 30,
  rec_schedule TEXT NOT NULL DEFAULT '111111111111111111111111',
  motion_threshold INTEGER NOT NULL DEFAULT 0,
  motion_sensitivity INTEGER NOT NULL DEFAULT 50,
  motion_area BLOB,
  ptz_speed INTEGER NOT NULL DEFAULT 3,
  connected_wire TEXT  -- one byte an output: its value, not a digit
);

CREATE TABLE camdeviceoutput (
  id INTEGER PRIMARY KEY AUTOINCREMENT,
  cam_id INTEGER NOT NULL,
  cam_id_on_rec_server INTEGER NOT NULL,
  owner_ds_id INTEGER NOT NULL,
  type INTEGER NOT NULL,
  idx INTEGER NOT NULL,
  name TEXT NOT NULL,
  normal_state INTEGER NOT NULL DEFAULT 0,
  trigger_seconds INTEGER NOT NULL DEFAULT 10,
  note TEXT NOT NULL DEFAULT ''
);

CREATE TABLE setting (key TEXT PRIMARY KEY, value TEXT) WITHOUT ROWID;
INSERT INTO setting VALUES ('schema_version', '83'), ('site', 'Warehouse'), ('storage', NULL);

-- TVIP62000 of any vendor: names of resolutions become pixels.
INSERT INTO camera (id, name, vendor, model, resolution, live_resolution) VALUES
  (1, 'changes', 'ABUS', 'TVIP62000', 'QVGA', 'QVGA'),
  (2, 'changes', 'ABUS', 'TVIP62000', 'VGA', 'QVGA'),  -- live view follows, whatever it was
  (3, 'changes', 'Eyseo', 'TVIP62000', 'UXGA', '1280x720'),
  (4, 'must stay', 'ABUS', 'TVIP62000', '640x480', 'VGA'),  -- only the recording is looked at
  (5, 'must stay', 'ABUS', 'TVIP62000', 'vga', 'vga'),  -- the letter case differs
  (6, 'must stay', 'ABUS', 'TVIP62500', 'VGA', 'VGA');  -- another model

-- The vendor Siemens.
INSERT INTO camera (id, name, vendor, model) VALUES
  (7, 'changes', 'Siemens', 'CCMS2025'),
  (8, 'must stay', 'SIEMENS', 'CFMS2025'),  -- has its new name
  (9, 'must stay', 'siemens', 'CCIS1425');  -- the letter case differs

-- HIKVISION models.
INSERT INTO camera (id, name, vendor, model) VALUES
  (10, 'changes', 'HIKVISION', 'DS2CD864FWD-E'),
  (11, 'changes', 'HIKVISION', 'DS2CD853F-E'),
  (12, 'changes', 'HIKVISION', 'DS2CD764FWD-E'),
  (13, 'changes', 'HIKVISION', 'DS2CD783F-E'),
  (14, 'changes', 'HIKVISION', 'DS2CD883F-E'),
  (15, 'changes', 'HIKVISION', 'DS2CD7164-E'),
  (16, 'changes', 'HIKVISION', 'DS2CD7153-E'),
  (17, 'changes', 'HIKVISION', 'DS2CD8153F-E'),
  (18, 'changes', 'HIKVISION', 'DS2CD8254F-EI'),
  (19, 'changes', 'HIKVISION', 'DS2CD8264FWD-EI'),
  (20, 'changes', 'HIKVISION', 'DS-2CD2612F-S'),
  (21, 'must stay', 'HIKVISION', 'DS-2CD2612F-IS'),  -- has its new name
  (22, 'must stay', 'Hikvision', 'DS2CD853F-E'),  -- another vendor
  (23, 'must stay', 'HIKVISION', 'DS2CD2032-I');  -- another model

-- Fisheye and multi-lens cameras without a field of view, or with one of the old names.
INSERT INTO camera (id, name, vendor, model, fov) VALUES
  (24, 'changes', 'D-Link', 'DCS-6010L', ''),
  (25, 'must stay', 'D-Link', 'DCS-6010L', 'Panorama'),  -- has one
  (26, 'changes', 'MOBOTIX', 'Q24M-Sec', ''),
  (27, 'must stay', 'MOBOTIX', 'Q24M-Sec', '4 Views'),  -- has one
  (28, 'changes', 'PIXORD', 'ND636E', ''),
  (29, 'must stay', 'MOBOTIX', 'ND636E', ''),  -- another vendor
  (30, 'changes', 'Panasonic-iPro', 'WV-SF438', '1.3M Fisheye [4:3]'),
  (31, 'changes', 'Panasonic-iPro', 'WV-SF438', '3M Fisheye [4:3]'),
  (32, 'changes', 'Panasonic-iPro', 'WV-SF438', '3M Panorama'),  -- only its vendor changes
  (33, 'must stay', 'Panasonic', 'WV-SF438', '3M Fisheye [4:3]'),  -- another vendor
  (34, 'changes', 'MOBOTIX', 'D14D-Sec-DNight', ''),
  (35, 'changes', 'MOBOTIX', 'M12D-Sec-DNight', ''),
  (36, 'must stay', 'MOBOTIX', 'D14D-Sec-DNight', 'Right Lens'),  -- has one
  (37, 'changes', 'Reolink', 'RLC-423', ''),
  (38, 'changes', 'Reolink', 'RLC-411', ''),
  (39, 'changes', 'Reolink', 'RLC-411S', ''),
  (40, 'changes', 'Reolink', 'RLC-411WS', ''),
  (41, 'must stay', 'Reolink', 'RLC-411', '3MP'),  -- has one
  (42, 'must stay', 'Reolink', 'RLC-410', '');  -- another model

-- FCS-1141 of any vendor.
INSERT INTO camera (id, name, vendor, model) VALUES
  (43, 'changes', 'LevelOne', 'FCS-1141'),
  (44, 'changes', 'Digitus', 'FCS-1141'),
  (45, 'must stay', 'LevelOne', 'FCS-1141(PAL)');  -- another model

-- AXIS M3007: its first channel is a view.
INSERT INTO camera (id, name, vendor, model, channel) VALUES
  (46, 'changes', 'AXIS', 'M3007', '1'),
  (47, 'changes', 'AXIS', 'M3007-P', '1'),
  (48, 'changes', 'AXIS', 'M3007-PV', '1'),
  (49, 'must stay', 'AXIS', 'M3007', 'Panorama'),  -- another channel
  (50, 'must stay', 'AXIS', 'M3006', '1');  -- another model

-- TOSHIBA IK-WD01A and IK-WB70A: each stream by itself.
INSERT INTO camera (id, name, vendor, model, resolution, live_resolution, mobile_resolution) VALUES
  (51, 'changes', 'TOSHIBA', 'IK-WD01A', '320x240', '320x240', '320x240'),
  (52, 'changes', 'TOSHIBA', 'IK-WB70A', '320x240', '640x480', '640x480'),
  (53, 'changes', 'TOSHIBA', 'IK-WB70A', '640x480', '320x240', '320x240'),
  (54, 'changes', 'TOSHIBA', 'IK-WD01A', '640x480', '640x480', '320x240'),
  (55, 'must stay', 'TOSHIBA', 'IK-WB16A', '320x240', '320x240', '320x240');  -- another model

-- TRENDNet models whose audio format is set whatever it was.
INSERT INTO camera (id, name, vendor, model, audio_format) VALUES
  (56, 'changes', 'TRENDNet', 'TV-IP312WN', 0),
  (57, 'changes', 'TRENDNet', 'TV-IP312W', 1),
  (58, 'changes', 'TRENDNet', 'TV-IP312', 3),
  (59, 'changes', 'TRENDNet', 'TV-IP422W', 1),
  (60, 'changes', 'TRENDNet', 'TV-IP422', 1),
  (61, 'changes', 'TRENDNet', 'TV-IP262P', 1),
  (62, 'changes', 'TRENDNet', 'TV-IP262PI', 1),
  (63, 'must stay', 'TRENDNet', 'TV-IP312', 2),  -- has it
  (64, 'must stay', 'TRENDNet', 'TV-IP512', 1);  -- another model

-- Fisheye stream numbers 0: live view of Vivotek goes to 2, all others to 1.
INSERT INTO camera (id, name, vendor, model, rec_stream_no, live_stream_no, mobile_stream_no) VALUES
  (65, 'changes', 'Vivotek', 'FE8171V', 0, 0, 0),  -- the mobile one stays 0
  (66, 'changes', 'Vivotek', 'FE8172', 0, 0, 1),
  (67, 'changes', 'Vivotek', 'FE8172V', 0, 0, 1),
  (68, 'changes', 'Vivotek', 'FE8173', 0, 0, 1),
  (69, 'changes', 'Vivotek', 'FE8172', 0, 3, 1),
  (70, 'changes', 'Vivotek', 'FE8172', 3, 0, 1),
  (71, 'changes', 'PIXORD', 'PB670', 0, 0, 0),  -- the mobile one stays 0
  (72, 'changes', 'PIXORD', 'PB670E', 0, 0, 1),
  (73, 'changes', 'PIXORD', 'PD637', 0, 0, 1),
  (74, 'changes', 'PIXORD', 'PD637E', 0, 0, 1),
  (75, 'changes', 'PIXORD', 'PD637', 0, 2, 1),
  (76, 'changes', 'PIXORD', 'PD637', 2, 0, 1),
  (77, 'must stay', 'Vivotek', 'FE8173', 2, 1, 0),  -- has its numbers
  (78, 'must stay', 'Vivotek', 'PD637', 0, 0, 0);  -- another vendor's model

-- Panasonic models that change to RTSP protocol 1.
INSERT INTO camera (id, name, vendor, model, rtsp_protocol) VALUES
  (79, 'changes', 'Panasonic', 'BB-HCM527', 0),
  (80, 'changes', 'Panasonic', 'BL-C111', 0),
  (81, 'changes', 'Panasonic', 'BL-C131', 2),
  (82, 'changes', 'Panasonic', 'BB-HCM715', 0),
  (83, 'changes', 'Panasonic', 'BB-HCM735', 3),
  (84, 'changes', 'Panasonic', 'BB-HCM515', 0),
  (85, 'changes', 'Panasonic', 'BB-HCM547', 0),
  (86, 'must stay', 'Panasonic', 'BB-HCM527', 1),  -- has it
  (87, 'must stay', 'Panasonic', 'BB-HCM531', 0);  -- another model

-- Grandstream: stream numbers of two models, 1088 lines of three with video type 3.
INSERT INTO camera (id, name, vendor, model, video_type,
                    rec_stream_no, live_stream_no, mobile_stream_no,
                    resolution, live_resolution, mobile_resolution) VALUES
  (88, 'changes', 'Grandstream', 'GXV3651_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),
  (89, 'changes', 'Grandstream', 'GXV3662_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),
  (90, 'changes', 'Grandstream', 'GXV3651_FHD', 3, 0, 2, 2, '1280x720', '1280x720', '1920x1088'),
  (91, 'changes', 'Grandstream', 'GXV3662_FHD', 1, 2, 0, 2, '1920x1088', '1920x1088', '1920x1088'),  -- keeps 1088
  (92, 'changes', 'Grandstream', 'GXV3672_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088'),  -- keeps 0
  (93, 'must stay', 'Grandstream', 'GXV3672_FHD', 3, 0, 0, 0, '1920x1080', '640x480', '640x480'),
  (94, 'must stay', 'Grandstream', 'GXV3674_FHD', 3, 0, 0, 0, '1920x1088', '1920x1088', '1920x1088');

-- Sony SNC-CH210: the threshold becomes a sensitivity.
INSERT INTO camera (id, name, vendor, model, motion_threshold, motion_sensitivity) VALUES
  (95, 'changes', 'Sony', 'SNC-CH210', 30, 50),
  (96, 'changes', 'Sony', 'SNC-CH210', 100, 20),
  (162, 'changes', 'Sony', 'SNC-CH210', 1, 50),  -- the least threshold
  (97, 'must stay', 'Sony', 'SNC-CH210', 0, 40),  -- no threshold
  (98, 'must stay', 'SONY', 'SNC-CH210', 30, 50);  -- another vendor

-- BOSCH VJR-811-IWCV.
INSERT INTO camera (id, name, vendor, model, tv_standard) VALUES
  (99, 'changes', 'BOSCH', 'VJR-811-IWCV', 0),
  (100, 'must stay', 'BOSCH', 'VJR-811-IWCV', 2),  -- has a standard
  (101, 'must stay', 'BOSCH', 'VJR-831-IWCV', 0);  -- another model

-- Panasonic WV-SFN631L, while its vendor still has the old name.
INSERT INTO camera (id, name, vendor, model, osd_position) VALUES
  (102, 'changes', 'Panasonic-iPro', 'WV-SFN631L', 0),
  (103, 'changes', 'Panasonic-iPro', 'WV-SFN631L', 6),  -- only its vendor changes
  (104, 'must stay', 'Panasonic', 'WV-SFN631L', 0);  -- another vendor

-- DAHUA SD40212S-HN and its two sisters: bit and frame rate of a stream with rate control 2.
INSERT INTO camera (id, name, vendor, model, resolution, live_resolution, mobile_resolution,
                    rec_bitrate_ctrl, live_bitrate_ctrl, mobile_bitrate_ctrl) VALUES
  (105, 'changes', 'DAHUA', 'SD40212S-HN', '1280x960', '1280x960', '640x480', 2, 2, 2),
  (106, 'changes', 'DAHUA', 'SD42212S-HN', '640x480', '640x480', '1280x960', 2, 2, 2),
  (107, 'changes', 'DAHUA', 'SD42C212S-HN', '1280x960', '640x480', '640x480', 2, 2, 2),
  (108, 'changes', 'DAHUA', 'SD42212S-HN', '640x480', '1280x960', '1280x960', 1, 1, 1),  -- keeps its rates
  (109, 'changes', 'DAHUA', 'SD42C212S-HN', '640x480', '704x480', '352x240', 2, 2, 2),  -- recording only
  (110, 'changes', 'DAHUA', 'SD42C212S-HN', '704x480', '1280x960', '352x240', 2, 2, 2),  -- live view only
  (111, 'changes', 'DAHUA', 'SD42212S-HN', '704x480', '704x480', '640x480', 2, 2, 2),  -- mobile only
  (112, 'must stay', 'DAHUA', 'SD40212S-HN', '1920x1080', '1280x720', '352x240', 2, 2, 2),
  (113, 'must stay', 'DAHUA', 'SD50212S-HN', '1280x960', '1280x960', '640x480', 2, 2, 2);  -- another model

-- Panasonic WV-SC385: its video type decides, whatever it held.
INSERT INTO camera (id, name, vendor, model, video_type, fov, rec_stream_no, live_stream_no,
                    mobile_stream_no, ui_stream_no) VALUES
  (114, 'changes', 'Panasonic-iPro', 'WV-SC385', 1, '', 2, 3, 0, '2,3,0'),
  (115, 'changes', 'Panasonic-iPro', 'WV-SC385', 2, '16:9', 1, 1, 1, '1,1,1'),
  (116, 'changes', 'Panasonic-iPro', 'WV-SC385', 3, '4:3', 0, 0, 0, ''),
  (117, 'changes', 'Panasonic-iPro', 'WV-SC385', 4, '', 0, 0, 0, ''),  -- only its vendor changes
  (118, 'must stay', 'Panasonic', 'WV-SC385', 1, '', 0, 0, 0, '');  -- another vendor

-- TRENDNet TV-IP311PI: stream numbers by video type, and the highest bit rate.
INSERT INTO camera (id, name, vendor, model, video_type,
                    rec_stream_no, live_stream_no, mobile_stream_no,
                    ui_stream_no, rec_cbr_bitrate, live_cbr_bitrate, mobile_cbr_bitrate) VALUES
  (119, 'changes', 'TRENDNet', 'TV-IP311PI', 3, 0, 0, 0, '0,0,0', 16384, 16384, 512),
  (120, 'changes', 'TRENDNet', 'TV-IP311PI', 3, 0, 0, 0, '0,0,0', 12288, 16384, 512),  -- keeps its rates
  (163, 'changes', 'TRENDNet', 'TV-IP311PI', 3, 2, 0, 0, '2,0,0', 12289, 512, 512),  -- just above
  (121, 'changes', 'TRENDNet', 'TV-IP311PI', 3, 2, 0, 0, '2,0,0', 16384, 512, 512),  -- keeps its numbers
  (122, 'changes', 'TRENDNet', 'TV-IP311PI', 1, 0, 0, 0, '0,0,0', 16384, 512, 512),  -- keeps its rates
  (123, 'must stay', 'TRENDNet', 'TV-IP311PI', 1, 1, 0, 0, '1,0,0', 16384, 512, 512),  -- has its number
  (124, 'must stay', 'TRENDNet', 'TV-IP311PI', 2, 0, 0, 0, '0,0,0', 16384, 512, 512);  -- another type

-- The vendor Panasonic-iPro, all models.
INSERT INTO camera (id, name, vendor, model) VALUES
  (125, 'changes', 'Panasonic-iPro', 'WV-SP105'),
  (126, 'must stay', 'Panasonic-IPRO', 'WV-SP105');  -- the letter case differs

-- FI9828P of any vendor.
INSERT INTO camera (id, name, vendor, model) VALUES
  (127, 'changes', 'FOSCAM', 'FI9828P'),
  (128, 'changes', 'Generic', 'FI9828P'),
  (129, 'must stay', 'FOSCAM', 'FI9828P V2'),  -- has its new name
  (130, 'must stay', 'FOSCAM', 'FI9828W');  -- another model

-- Y-CAM BULLET HD.
INSERT INTO camera (id, name, vendor, model, video_type) VALUES
  (131, 'changes', 'Y-CAM', 'BULLET HD', 2),
  (132, 'must stay', 'Y-CAM', 'BULLET HD', 1),  -- another type
  (133, 'must stay', 'Y-CAM', 'CUBE HD', 2);  -- another model

-- HJT, SHARP and ASUS models.
INSERT INTO camera (id, name, vendor, model) VALUES
  (134, 'changes', 'HJT', 'ICZX23'),
  (135, 'must stay', 'HJT', 'ICZX230'),  -- has its new name
  (136, 'changes', 'SHARP', 'LZ0P432B'),
  (137, 'changes', 'SHARP', 'LZ0P436B'),
  (138, 'changes', 'SHARP', 'LZ0P421A'),
  (139, 'changes', 'SHARP', 'LZ0P422A'),
  (140, 'changes', 'SHARP', 'QB-G20C'),
  (141, 'must stay', 'SHARP', 'QG-B20C'),  -- has its new name
  (142, 'must stay', 'Sharp', 'LZ0P432B'),  -- another vendor
  (143, 'changes', 'ASUS', 'AiCam NightView'),
  (144, 'must stay', 'ASUS', 'AiCam');  -- another model

-- TP-LINK NC450 of unknown firmware.
INSERT INTO camera (id, name, vendor, model, firmware) VALUES
  (145, 'changes', 'TP-LINK', 'NC450', ''),
  (146, 'must stay', 'TP-LINK', 'NC450', '1.10'),  -- known
  (147, 'must stay', 'TP-LINK', 'NC250', '');  -- another model

-- AXIS A8105-E: the wiring names a second output, which gets a row of its own.
INSERT INTO camera (id, name, vendor, model, id_on_rec_server, owner_ds_id, connected_wire) VALUES
  (148, 'changes', 'AXIS', 'A8105-E', 0, 0, ''),
  (149, 'changes', 'AXIS', 'A8105-E', 0, NULL, NULL),
  (150, 'changes', 'AXIS', 'A8105-E', -1, 2, char(3)),
  (151, 'changes', 'AXIS', 'A8105-E', NULL, 2, char(1, 4)),  -- its second byte stays
  (152, 'changes', 'AXIS', 'A8105-E', 7, 2, char(1, 1, 2)),
  (153, 'changes', 'AXIS', 'A8105-E', 8, 2, char(1, 1, 3)),  -- its third byte stays
  (154, 'changes', 'AXIS', 'A8105-E', 9, 3, char(1, 3, 3, 2)),  -- only its first byte changes
  (155, 'new output', 'AXIS', 'A8105-E', 10, 3, char(2, 1)),  -- keeps its wiring
  (156, 'must stay', 'AXIS', 'A8105-LE', 11, 3, char(1, 1, 2));  -- another model
INSERT INTO camera (id, name, vendor, model, connected_wire) VALUES
  (-4, 'changes', 'AXIS', 'A8105-E', '');

-- FOSCAM FI9901EP and R4: each stream by itself.
INSERT INTO camera (id, name, vendor, model, resolution, live_resolution, mobile_resolution) VALUES
  (157, 'changes', 'FOSCAM', 'FI9901EP', '2048x1536', '2048x1536', '2048x1536'),
  (158, 'changes', 'FOSCAM', 'R4', '2048x1536', '1280x720', '640x480'),
  (159, 'changes', 'FOSCAM', 'R4', '1280x720', '2048x1536', '640x480'),
  (160, 'changes', 'FOSCAM', 'R4', '1280x720', '1280x720', '2048x1536'),
  (161, 'must stay', 'FOSCAM', 'R2', '2048x1536', '2048x1536', '2048x1536');  -- another model

UPDATE camera SET ip = '192.0.2.' || (abs(id) % 256);

INSERT INTO camdeviceoutput (cam_id, cam_id_on_rec_server, owner_ds_id, type, idx, name)
  SELECT id, ifnull(id_on_rec_server, 0), ifnull(owner_ds_id, 0), 1, 0, 'DO 1'
  FROM camera WHERE id = -4 OR id BETWEEN 148 AND 156 ORDER BY id;
